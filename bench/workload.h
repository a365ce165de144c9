// What every part of the benchmark works on: one table of a page and nine
// objects with texts as a browser produces them, the collector's record
// path built the way the collector builds it, and temporary directories.
#ifndef WQ5_BENCH_WORKLOAD_H
#define WQ5_BENCH_WORKLOAD_H

#include <memory>
#include <string>
#include <vector>

#include "src/mdhandler.h"
#include "support/table_builder.h"

namespace wq5bench {

// One page and its nine objects.
constexpr int RECORDS_PER_TABLE = 10;

// The table in memory, laid out as the collection library delivers it.
// Each thread needs a table of its own: the record path substitutes the
// delimiter in its texts in place.
std::unique_ptr<wq5test::TableBuilder> buildTable();

// The same table as one line of a table script (libzub1api/README.md),
// without the newline.
std::string tableScriptLine();

// The same page as a HAR capture: one page, its document and nine
// objects, each request with its own timings.
std::string captureHar();

// A fresh directory under $TMPDIR (or /tmp), removed with its content.
class TempDir {
public:
    explicit TempDir(const char* purpose);
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& path() const { return m_path; }

private:
    std::string m_path;
};

// The collector's record path: the FilterManager singleton with its
// settings from WQ5_ variables, and a DataHandler of our own over it that
// writes page and object records into `logDir`. One at a time per process.
class Collector {
public:
    Collector(const std::string& logDir, long maxSizeMb);
    ~Collector();
    Collector(const Collector&) = delete;
    Collector& operator=(const Collector&) = delete;

    DataHandler& handler() { return *m_handler; }

private:
    std::unique_ptr<DataHandler> m_handler;
};

// The records the collector writes for one table, each with its newline:
// the bytes that the floor and spdlog write in its place.
std::vector<std::string> recordLines();

// Size in bytes of one table's records.
size_t tableBytes(const std::vector<std::string>& records);

}  // namespace wq5bench

#endif
