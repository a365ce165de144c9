// Browser captures (HAR) replayed through the real collector: every entry
// of a well-formed capture becomes exactly one well-formed record, fields
// land in the columns the library's README names, a malformed capture is
// reported once while the collector goes on, and replays repeat on request.
#include <gtest/gtest.h>

#include <array>
#include <csignal>
#include <filesystem>
#include <map>
#include <numeric>
#include <optional>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include <sys/stat.h>

#include "support/capture_counts.h"
#include "support/process.h"
#include "support/stderr_capture.h"

namespace {

using namespace wq5test;

struct Record {
    std::string tag;
    std::vector<std::string> columns;
};

// Every line of `log` as a record; a line that is not a well-formed record
// with the default delimiter fails the test, naming the line.
std::vector<Record> parseRecords(const std::string& log)
{
    static const std::map<std::string, size_t> COLUMNS = {{"hpage", 46}, {"hobj", 46}, {"video", 31}, {"audio", 31}};
    static const std::regex DATE("\\d{4}-\\d{2}-\\d{2}"), TIME("\\d{2}:\\d{2}:\\d{2}");
    static const std::regex RECORD("<([a-z]+)>(.*)</([a-z]+)>");
    std::vector<Record> records;
    for (size_t at = 0, end; at < log.size(); at = end + 1) {
        end = log.find('\n', at);
        const std::string line = log.substr(at, end - at);
        std::smatch parts;
        if (end == std::string::npos || !std::regex_match(line, parts, RECORD) || parts[1] != parts[3] ||
            COLUMNS.count(parts[1]) == 0) {
            ADD_FAILURE() << "not a record: " << line;
            continue;
        }
        Record record{parts[1], {}};
        const std::string body = parts[2];
        for (size_t from = 0, to = 0; to != std::string::npos; from = to + 1) {
            to = body.find('^', from);
            record.columns.push_back(body.substr(from, to == std::string::npos ? to : to - from));
        }
        if (record.columns.size() != COLUMNS.at(record.tag)) {
            ADD_FAILURE() << record.columns.size() << " columns in " << line;
            continue;
        }
        EXPECT_EQ(std::vector<std::string>(record.columns.begin(), record.columns.begin() + 4),
                  (std::vector<std::string>{"v121", "92", "0", "hartest"})) << line;
        EXPECT_TRUE(std::regex_match(record.columns[6], DATE) && std::regex_match(record.columns[7], TIME)) << line;
        records.push_back(record);
    }
    return records;
}

// A record from its sixth column on (after the GUID), joined again.
std::string afterGuid(const Record& record)
{
    std::string text;
    for (size_t i = 5; i < record.columns.size(); ++i) text += (i > 5 ? "^" : "") + record.columns[i];
    return text;
}

long counter(const std::string& status, const std::string& name)
{
    const size_t at = status.find("\"" + name + "\":");
    return at == std::string::npos ? -1 : std::stol(status.substr(at + name.size() + 3));
}

struct Outcome {
    std::vector<Record> records;
    std::array<int, 4> counts;  // records tagged hpage, hobj, video, audio
    std::string status;
    std::string errors;  // the collector's standard error
};

class HarReplayTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_FALSE((m_dir = makeTempDir()).empty()); }
    void TearDown() override { removeTree(m_dir); }

    // Replays `file` through the collector with every switch on and one
    // library thread, and stops it with SIGTERM once the library is idle.
    Outcome run(const std::string& file, std::map<std::string, std::string> env = {})
    {
        const std::string dir = m_dir + "/" + std::to_string(++m_runs);
        EXPECT_EQ(0, mkdir(dir.c_str(), 0700));
        EXPECT_EQ(0, mkdir((dir + "/log").c_str(), 0700));
        env.insert({{"MOQ_TRACE", "error"}, {"MOQ_TRACE_FILE", dir + "/trace.log"}, {"WQ5_WORK_PATH", "\x01unset"},
                    {"WQ5_COLLECTOR_ID", "hartest"}, {"WQ5_LOG_DIR", dir + "/log"},
                    {"WQ5_LOG_SAMPLE_PERCENTAGE", "100"}, {"WQ5_LOG_MAX_SIZE_MB", "\x01unset"},
                    {"WQ5_FIELD_DELIMITER", "\x01unset"}, {"WQ5_SUB_CHAR", "\x01unset"}, {"ZUB1_REPLAY", file},
                    {"ZUB1_STATUS_FILE", dir + "/status.json"}, {"ZUB1_THREADS", "1"}, {"ZUB1_START_DELAY_MS", "\x01unset"},
                    {"ZUB1_REGISTER_FAILURES", "\x01unset"}, {"ZUB1_LOOPS", "\x01unset"}, {"ZUB1_RATE", "\x01unset"}});
        std::optional<Collector> collector;
        startAllKinds(collector, env, dir + "/stderr.txt");
        EXPECT_TRUE(collector->started());
        EXPECT_TRUE(waitFor(dir, [&] { return access((dir + "/status.json").c_str(), F_OK) == 0; }))
            << "the library never became idle on " << file;
        collector->signal(SIGTERM);
        const int exit = collector->wait();
        EXPECT_TRUE(WIFEXITED(exit) && WEXITSTATUS(exit) == 0) << file << ": wait status " << exit;
        std::string log;
        std::set<std::string> names;
        for (const auto& item : std::filesystem::directory_iterator(dir + "/log")) names.insert(item.path());
        for (const std::string& name : names) log += readFile(name);
        Outcome outcome{parseRecords(log), {}, readFile(dir + "/status.json"), readFile(dir + "/stderr.txt")};
        for (const Record& record : outcome.records) {
            const char* const tags[] = {"hpage", "hobj", "video", "audio"};
            ++outcome.counts[std::find(std::begin(tags), std::end(tags), record.tag) - std::begin(tags)];
        }
        return outcome;
    }

    std::string m_dir;
    int m_runs = 0;
};

TEST_F(HarReplayTest, EveryEntryOfACaptureYieldsOneRecord)
{
    ASSERT_TRUE(std::filesystem::is_directory(CAPTURES)) << CAPTURES << " is missing beside the checkout";
    std::set<std::string> known;
    for (const CaptureRow& row : CAPTURE_ROWS) known.insert(row.file);
    for (const auto& item : std::filesystem::directory_iterator(CAPTURES)) {
        EXPECT_TRUE(item.path().extension() != ".har" || known.count(item.path().filename()) == 1) << item.path();
    }
    for (const CaptureRow& row : CAPTURE_ROWS) {
        SCOPED_TRACE(row.file);
        const Outcome result = run(capturePath(row.file));
        EXPECT_EQ(result.counts, row.records);
        if (row.error != nullptr) {  // the collector went on: it stopped in order on SIGTERM
            const std::string line = "zub1api: " + capturePath(row.file) + ": " + row.error;
            EXPECT_EQ(result.errors.compare(0, line.size(), line), 0) << result.errors;
            EXPECT_EQ(std::count(result.errors.begin(), result.errors.end(), '\n'), 1) << result.errors;
            EXPECT_EQ(counter(result.status, "invalid"), 1) << result.status;
            continue;
        }
        EXPECT_EQ(counter(result.status, "entries"),
                  std::accumulate(row.records.begin(), row.records.end(), row.skipped));
        EXPECT_EQ(counter(result.status, "skipped"), row.skipped);
        EXPECT_EQ(counter(result.status, "invalid") + counter(result.status, "unmatched"), 0) << result.status;
        EXPECT_EQ(result.errors, "");
    }
}

// Values from samples/demo.har, placed by the mapping: a page (+00:00), the
// redirect before it, a video (video/mp4) and an audio (audio/mpeg, -05:00).
TEST_F(HarReplayTest, CaptureValuesLandInTheirColumns)
{
    const std::map<std::string, std::string> expected = {
        {"hpage", "8^2024-03-05^13:46:01^214^2001:db8:10::443^HTTP/2^443^Firefox^2^0^-1^-1^-1^0^170^44^6527^"
                  "https://secure.example.com/account/login^text/html; charset=utf-8^OK^N/A^GET^6125^402^20410^364^0^"
                  "455^702^14285^182^-1^-1^-1^secure.example.com^/account/login^login^N/A^N/A^"
                  "Sign in - Example Account^200"},
        {"hobj", "7^2024-03-05^13:46:01^180^2001:db8:10::443^HTTP/2^443^Firefox^2^1^22^96^61^0^58^3^214^"
                 "https://secure.example.com/login^text/html^Moved Permanently^"
                 "https://secure.example.com/account/login^"
                 "GET^0^214^0^356^0^-1^-1^-1^0^-1^-1^-1^secure.example.com^/login^login^N/A^N/A^N/A^301"},
        {"video", "13^2024-03-05^13:47:31^2350^203.0.113.80^HTTP/2^443^Firefox^3^1^9^75^40^0^110^2155^9830810^7^"
                  "https://media.example.com/news/keynote-0305.mp4^video/mp4^Partial Content^"
                  "Keynote, 5 March - Example News^GET^206^9830400^9830400"},
        {"audio", "16^2024-03-05^13:49:05^60000^198.51.100.40^HTTP/1.1^80^Firefox^4^0^-1^-1^-1^0^95^59905^1966324^9^"
                  "http://radio.example.org/live/classic.mp3^audio/mpeg^OK^Classic FM - listen live^GET^200^1966080^"
                  "1966080"},
    };
    const Outcome result = run(DEMO);
    std::map<std::string, int> found;
    for (const Record& record : result.records) {
        const std::string& want = expected.at(record.tag);
        if (want.compare(0, want.find('^'), record.columns[5]) != 0) continue;  // by entry number
        EXPECT_EQ(afterGuid(record), want);
        ++found[record.tag];
    }
    EXPECT_EQ(found, (std::map<std::string, int>{{"audio", 1}, {"hobj", 1}, {"hpage", 1}, {"video", 1}}));
}

// Entries without page, in file order unlike time order: a document starts
// a page; the request before the first document belongs to the first page.
TEST_F(HarReplayTest, EntriesWithoutPageAreGroupedByTheirDocuments)
{
    const std::string har = m_dir + "/loose.har";
    writeFile(har, R"({"log": {"version": "1.2", "entries": [
      {"startedDateTime": "2024-01-01T00:31:00.500Z", "request": {"url": "http://a.example/next"},
       "response": {"status": 200, "content": {"mimeType": "text/html"}}},
      {"startedDateTime": "2023-12-31T23:30:59.999999-01:00", "request": {"url": "http://a.example/"},
       "response": {"status": 200, "content": {"mimeType": "text/html"}}},
      {"startedDateTime": "2024-01-01T00:30:59.100Z", "request": {"url": "http://a.example/style.css"}},
      {"startedDateTime": "2024-01-01T00:31:00.100Z", "request": {"url": "http://a.example/gone.png"},
       "response": {"status": 404, "content": {"mimeType": "text/html"}}},
      {"startedDateTime": "2024-01-01T00:31:01Z", "request": {"url": "blob:http://a.example/1"}},
      {"startedDateTime": "2024-01-01T00:31:01Z", "request": {}},
      {"startedDateTime": "2024-01-01T01:31:02+0100", "request": {"url": "https://a.example/live.ra"},
       "response": {"headers": [{"name": "content-type", "value": "audio/x-pn-realaudio"}]}},
      {"startedDateTime": "2024-01-01T00:31:01.250Z", "request": {"url": "http://a.example/app.js"}}]}})");
    const Outcome result = run(har);
    std::vector<std::string> order;
    for (const Record& record : result.records) order.push_back(record.tag + " " + record.columns[5]);
    EXPECT_EQ(order, (std::vector<std::string>{"hpage 2", "hobj 3", "hobj 4", "hpage 1", "hobj 8", "audio 7"}));
    ASSERT_EQ(result.records.size(), 6u);
    EXPECT_EQ(afterGuid(result.records[0]),
              "2^2024-01-01^00:30:59^-1^^^80^^1^-1^-1^-1^-1^-1^-1^-1^-1^http://a.example/^text/html^N/A^N/A^N/A^"
              "-1^-1^-1^-1^-1^-1^-1^-1^899^-1^-1^-1^a.example^/^N/A^N/A^N/A^N/A^200");
    EXPECT_EQ(afterGuid(result.records[5]),
              "7^2024-01-01^00:31:02^-1^^^443^^2^-1^-1^-1^-1^-1^-1^-1^-1^10^https://a.example/live.ra^"
              "audio/x-pn-realaudio^N/A^N/A^N/A^-1^-1^-1");
    EXPECT_EQ(counter(result.status, "skipped"), 2);
    EXPECT_EQ(result.errors, "zub1api: " + har + ": entry 6 has no request URL; skipped\n");
}

TEST_F(HarReplayTest, LoopsRepeatTheReplay)
{
    const struct {
        std::string file, loops, rate;
        std::array<int, 4> records;
    } rows[] = {
        {DEMO, "3", "200", {12, 27, 3, 3}},
        {WQ5_SOURCE_DIR "/samples/demo.jsonl", "2", "", {8, 14, 2, 2}},  // a table script
    };
    for (const auto& row : rows) {
        const Outcome result = run(row.file, {{"ZUB1_LOOPS", row.loops}, {"ZUB1_RATE", row.rate}});
        EXPECT_EQ(result.counts, row.records) << row.file;
        EXPECT_EQ(result.errors, "") << row.file;
    }
}

}  // namespace
