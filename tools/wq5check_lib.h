// Checks the log files of one directory: every line must be one whole record
// (opening and closing tag alike, the column count of its tag), and, when the
// writer of the entries put a sequence number into each URL's query, every
// number from 0 up to the highest must be there exactly once.
#ifndef WQ5_TOOLS_WQ5CHECK_LIB_H
#define WQ5_TOOLS_WQ5CHECK_LIB_H

#include <map>
#include <string>
#include <vector>

namespace wq5check {

struct Options {
    char delimiter = '^';
    // Query key whose value numbers the entries ("seq" for ...?seq=17);
    // empty: no sequence check.
    std::string seqField;
};

struct Report {
    std::vector<std::string> files;     // log file names, by day and then by number
    std::map<std::string, long> records;  // whole records per tag
    long torn = 0;           // lines that are no whole record
    long unnumbered = 0;     // whole records without a readable sequence number
    long duplicates = 0;     // sequence numbers seen more than once (each extra sighting)
    long gaps = 0;           // numbers missing between 0 and the highest seen
    long misnamed = 0;       // missing numbers in a day's file names; unreadable files
    long distinct = 0;       // distinct sequence numbers seen
    long long highest = -1;  // highest sequence number seen
    std::vector<std::string> problems;  // the first few, "file:line: what"

    long total() const;
    bool clean() const { return torn + unnumbered + duplicates + gaps + misnamed == 0; }
};

// Reads every file of `dir` named like a log file (YYYYMMDD.wq5 or
// YYYYMMDD.N.wq5); other names are passed over. An unreadable directory
// counts as misnamed.
Report checkDirectory(const std::string& dir, const Options& options);

// The report as the command prints it.
std::string summary(const Report& report);

}  // namespace wq5check

#endif
