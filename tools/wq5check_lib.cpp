#include "wq5check_lib.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <tuple>

namespace wq5check {

namespace {

const size_t MAX_PROBLEMS = 10;

// Columns of a whole record per tag: 5 header and 17 common columns, then
// 24 HTTP or 9 media columns.
const std::map<std::string, size_t> COLUMNS = {{"hpage", 46}, {"hobj", 46}, {"video", 31}, {"audio", 31}};
// Where the query is: HTTP column 21 holds it alone, media column 2 the whole URL.
const size_t HTTP_QUERY = 5 + 17 + 20, MEDIA_URL = 5 + 17 + 1;

void note(Report& report, const std::string& what)
{
    if (report.problems.size() < MAX_PROBLEMS)
        report.problems.push_back(what);
}

// The day and number (0 for none) of a log file name such as
// "20240305.wq5" or "20240305.12.wq5"; false for any other name.
bool parseLogName(const std::string& name, std::string& day, int& number)
{
    static const std::string DIGITS = "0123456789", SUFFIX = ".wq5";
    if (name.size() < 8 + SUFFIX.size() || name.compare(name.size() - SUFFIX.size(), SUFFIX.size(), SUFFIX) != 0)
        return false;
    day = name.substr(0, 8);
    const std::string middle = name.substr(8, name.size() - 8 - SUFFIX.size());  // "" or ".N"
    if (day.find_first_not_of(DIGITS) != std::string::npos)
        return false;
    number = 0;
    if (middle.empty())
        return true;
    const std::string digits = middle.substr(1);
    if (middle[0] != '.' || digits.empty() || digits.size() > 9 || digits[0] == '0' ||
        digits.find_first_not_of(DIGITS) != std::string::npos)
        return false;
    number = std::stoi(digits);
    return true;
}

// Splits a line into its tag and columns; the empty text when the line is
// one whole record, else what is wrong with it.
std::string readRecord(const std::string& line, char delimiter, std::string& tag, std::vector<std::string>& columns)
{
    const size_t open = line.find('>');
    if (line.empty() || line[0] != '<' || open == std::string::npos)
        return "no opening tag";
    tag = line.substr(1, open - 1);
    const auto known = COLUMNS.find(tag);
    if (known == COLUMNS.end())
        return "unknown tag <" + tag + ">";
    const size_t close = line.rfind("</");
    if (close == std::string::npos || close <= open || line.back() != '>')
        return "no closing tag";
    const std::string closeTag = line.substr(close + 2, line.size() - close - 3);
    if (closeTag != tag)
        return "opened by <" + tag + ">, closed by </" + closeTag + ">";
    columns.clear();
    const std::string body = line.substr(open + 1, close - open - 1);
    for (size_t from = 0;; ) {
        const size_t to = body.find(delimiter, from);
        columns.push_back(body.substr(from, to == std::string::npos ? std::string::npos : to - from));
        if (to == std::string::npos)
            break;
        from = to + 1;
    }
    if (columns.size() != known->second)
        return std::to_string(columns.size()) + " columns in <" + tag + ">, not " + std::to_string(known->second);
    return std::string();
}

// The value of `key` in the record's URL query, if it is a decimal number.
bool sequenceOf(const std::string& tag, const std::vector<std::string>& columns, const std::string& key,
                long long& seq)
{
    std::string query;
    if (tag == "hpage" || tag == "hobj") {
        query = columns[HTTP_QUERY];
    } else {
        const std::string& url = columns[MEDIA_URL];
        const size_t mark = url.find('?');
        if (mark == std::string::npos)
            return false;
        query = url.substr(mark + 1, url.find('#', mark) - mark - 1);
    }
    std::istringstream pairs(query);
    for (std::string pair; std::getline(pairs, pair, '&');) {
        if (pair.compare(0, key.size() + 1, key + "=") != 0)
            continue;
        const std::string digits = pair.substr(key.size() + 1);
        if (digits.empty() || digits.size() > 18 || digits.find_first_not_of("0123456789") != std::string::npos)
            return false;
        seq = std::stoll(digits);
        return true;
    }
    return false;
}

void checkFile(const std::string& path, const std::string& name, const Options& options, Report& report,
               std::vector<long long>& seqs)
{
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        ++report.misnamed;
        note(report, name + ": cannot be read");
        return;
    }
    std::ostringstream text;
    text << in.rdbuf();
    const std::string content = text.str();
    std::string tag;
    std::vector<std::string> columns;
    long lineNo = 0;
    for (size_t at = 0; at < content.size();) {
        const size_t end = content.find('\n', at);
        const std::string line = content.substr(at, end == std::string::npos ? std::string::npos : end - at);
        at = end == std::string::npos ? content.size() : end + 1;
        const std::string where = name + ":" + std::to_string(++lineNo) + ": ";
        std::string wrong = readRecord(line, options.delimiter, tag, columns);
        if (wrong.empty() && end == std::string::npos)
            wrong = "the file ends inside the record";
        if (!wrong.empty()) {
            ++report.torn;
            note(report, where + wrong);
            continue;
        }
        ++report.records[tag];
        long long seq = 0;
        if (options.seqField.empty())
            continue;
        if (sequenceOf(tag, columns, options.seqField, seq)) {
            seqs.push_back(seq);
        } else {
            ++report.unnumbered;
            note(report, where + "no number under \"" + options.seqField + "\" in <" + tag + ">");
        }
    }
}

// Counts duplicates and the numbers missing below the highest.
void checkSequence(std::vector<long long>& seqs, Report& report)
{
    std::sort(seqs.begin(), seqs.end());
    long long expected = 0;
    for (size_t i = 0; i < seqs.size(); ++i) {
        if (i > 0 && seqs[i] == seqs[i - 1]) {
            ++report.duplicates;
            note(report, "sequence " + std::to_string(seqs[i]) + " written more than once");
            continue;
        }
        if (seqs[i] > expected) {
            report.gaps += seqs[i] - expected;
            note(report, "sequence " + std::to_string(expected) + ".." + std::to_string(seqs[i] - 1) + " missing");
        }
        expected = seqs[i] + 1;
        ++report.distinct;
    }
    report.highest = seqs.empty() ? -1 : seqs.back();
}

}  // namespace

long Report::total() const
{
    long sum = 0;
    for (const auto& tagged : records)
        sum += tagged.second;
    return sum;
}

Report checkDirectory(const std::string& dir, const Options& options)
{
    Report report;
    std::vector<std::tuple<std::string, int, std::string>> logs;  // day, number, name
    std::error_code error;
    for (std::filesystem::directory_iterator it(dir, error), end; !error && it != end; it.increment(error)) {
        const std::string name = it->path().filename().string();
        std::string day;
        int number = 0;
        if (parseLogName(name, day, number))
            logs.emplace_back(day, number, name);
    }
    if (error) {
        ++report.misnamed;
        note(report, dir + ": " + error.message());
    }
    std::sort(logs.begin(), logs.end());
    std::vector<long long> seqs;
    for (size_t i = 0; i < logs.size(); ++i) {
        const auto& [day, number, name] = logs[i];
        const int expected = i > 0 && std::get<0>(logs[i - 1]) == day ? std::get<1>(logs[i - 1]) + 1 : 0;
        if (number != expected) {
            ++report.misnamed;
            note(report, day + ": files numbered " + std::to_string(expected) + ".." + std::to_string(number - 1) +
                             " missing");
        }
        report.files.push_back(name);
        checkFile(dir + "/" + name, name, options, report, seqs);
    }
    checkSequence(seqs, report);
    return report;
}

std::string summary(const Report& report)
{
    std::ostringstream out;
    out << "files: " << report.files.size() << "\n";
    for (const std::string& name : report.files)
        out << "  " << name << "\n";
    out << "records: " << report.total();
    for (const auto& tagged : report.records)
        out << (tagged.first == report.records.begin()->first ? " (" : ", ") << tagged.first << " " << tagged.second;
    out << (report.records.empty() ? "\n" : ")\n");
    if (report.highest >= 0)
        out << "sequence: 0.." << report.highest << ", " << report.distinct << " distinct\n";
    out << "torn " << report.torn << ", unnumbered " << report.unnumbered << ", duplicates " << report.duplicates
        << ", gaps " << report.gaps << ", misnamed files " << report.misnamed << "\n";
    for (const std::string& problem : report.problems)
        out << "  " << problem << "\n";
    out << (report.clean() ? "clean\n" : "NOT CLEAN\n");
    return out.str();
}

}  // namespace wq5check
