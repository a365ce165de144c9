// Log file naming, sequence numbers, retention, and the writer's open, rollover
// and recovery rules, in temporary directories, with a clock the tests step.
#include "src/mdwriter.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <climits>
#include <filesystem>
#include <functional>
#include <map>
#include <set>

#include "platform/moq.h"
#include "support/process.h"
#include "support/trace_capture.h"

namespace fs = std::filesystem;
using wq5test::readFile;

namespace {

// 2024-03-05 00:00:00 UTC: 2024-01-01 is 1704067200, plus 31 + 29 + 4 days.
const wq5_time_t MAR05 = 1704067200 + 64 * 86400, DAY = 86400, NOON = MAR05 + DAY / 2;
const int64_t MB = 1048576;
const int ALL_CLASSES = TRC_DETAIL | TRC_INFO | TRC_FLOW | TRC_ERROR;

// The clock of every writer in these tests.
std::atomic<wq5_time_t> g_now{0};
const bool s_clockSet = (setWriterClock([] { return g_now.load(); }), true);

struct TempDir {
    const std::string path = wq5test::makeTempDir();
    ~TempDir() { wq5test::removeTree(path); }
    std::string operator/(const std::string& name) const { return path + "/" + name; }
};

typedef std::map<std::string, int64_t> Files;  // name -> size (-1: not a regular file)

void makeFiles(const TempDir& dir, const Files& files)
{
    for (const auto& f : files) {
        wq5test::writeFile(dir / f.first, "");
        ASSERT_EQ(0, truncate((dir / f.first).c_str(), f.second)) << f.first;  // sparse: gigabytes cost nothing
    }
}

Files listDir(const std::string& dir)
{
    Files files;
    for (const fs::directory_entry& e : fs::directory_iterator(dir))
        files[e.path().filename()] = e.is_regular_file() ? static_cast<int64_t>(e.file_size()) : -1;
    return files;
}

// A record writer's road: lock, stream, one write, unlock. False when the record was dropped.
bool writeRecord(DataWriter& writer, const std::string& record)
{
    DataWriterLock lock(writer);
    FILE* stream = lock.getStream();
    return stream != nullptr && fwrite(record.data(), record.size(), 1, stream) == 1;
}

// The texts that `function` traced, in order.
std::vector<std::string> traced(const TraceCapture& capture, const std::string& function)
{
    const std::string mark = " " + function + ": ";
    std::vector<std::string> texts;
    for (const std::string& line : capture.lines()) {
        const size_t at = line.find(mark);
        if (at != std::string::npos)
            texts.push_back(line.substr(at + mark.size(), line.size() - at - mark.size() - 1));
    }
    return texts;
}

TEST(DataWriter, PeriodStartIsTheLatestUtcMidnightAndNamesTheDate)
{
    const struct { wq5_time_t now, start; const char* date; } rows[] = {
        {MAR05, MAR05, "20240305"}, {MAR05 - 1, MAR05 - DAY, "20240304"}, {MAR05 + DAY - 1, MAR05, "20240305"},
        {MAR05 + DAY, MAR05 + DAY, "20240306"}, {0, 0, "19700101"}, {59, 0, "19700101"},
        {946684800 + 59 * DAY + 7, 946684800 + 59 * DAY, "20000229"}};
    for (const auto& r : rows) {
        g_now = r.now;
        std::string date = "keep";
        time2str(r.now, date);
        EXPECT_EQ(r.start, calcPeriodStart(DAY)) << "now " << r.now;
        EXPECT_EQ(r.date, date) << "now " << r.now;
    }
    for (const wq5_time_t t : {INT64_MAX, wq5_time_t(40000000000000000)}) {  // no date, or a year too long
        std::string date = "keep";
        time2str(t, date);
        EXPECT_EQ("keep", date) << t;
    }
}

TEST(ParseSeq, NumberOfTheNameOrZero)
{
    const struct { const char* path; int seq; } rows[] = {
        {"log/20240305.12.wq5", 12}, {"log/20240305.007.wq5", 7}, {"20240305.5.wq5", 5}, {"/a/dir.d/20240305.3.wq5", 3},
        {"log/anything.9.wq5", 9}, {"log/20240305.2147483647.wq5", INT_MAX},
        {"log/20240305.000000000000000000042.wq5", 42}, {"log/20240305.wq5", 0}, {"log/20240305.1.2.wq5", 0},
        {"log/20240305..wq5", 0}, {"log/20240305.1a.wq5", 0}, {"log/20240305.3.log", 0}, {"log/20240305.3.WQ5", 0},
        {"log/20240305.3.wq5.bak", 0}, {"log/20240305.3.wq", 0}, {"log/20240305.3.", 0}, {"log/20240305.3", 0},
        {"log/20240305", 0}, {"log.d/20240305", 0}, {"log/20240305.-1.wq5", 0}, {"log/20240305.+1.wq5", 0},
        {"log/20240305. 1.wq5", 0}, {"log/20240305.2147483648.wq5", 0}, {"log/20240305.99999999999.wq5", 0},
        {"", 0}, {"wq5", 0}, {".wq5", 0}};
    for (const auto& r : rows) {
        std::string path = r.path;
        EXPECT_EQ(r.seq, parseSeq(&path[0], "wq5")) << "<" << r.path << ">";
        EXPECT_EQ(r.path, path) << "not restored";
    }
}

TEST(LogfileName, PicksTheDaysLatestFileOrTheNextNumber)
{
    const struct { const char* what; Files files; long mb; int64_t bytes; const char* expected; } rows[] = {
        {"no file of the day", {}, 0, 100, "20240305.wq5"},
        {"unnumbered within the limit", {{"20240305.wq5", 50}}, 0, 100, "20240305.wq5"},
        {"unnumbered exactly at the limit", {{"20240305.wq5", 100}}, 0, 100, "20240305.wq5"},
        {"unnumbered over the limit", {{"20240305.wq5", 101}}, 0, 100, "20240305.1.wq5"},
        {"no limit", {{"20240305.wq5", MB}, {"20240305.2.wq5", MB}}, 0, 0, "20240305.2.wq5"},
        {"1 and 3, 3 within", {{"20240305.1.wq5", 101}, {"20240305.3.wq5", 10}}, 0, 100, "20240305.3.wq5"},
        {"1 and 3, 3 over: gaps stay", {{"20240305.1.wq5", 101}, {"20240305.3.wq5", 101}}, 0, 100, "20240305.4.wq5"},
        {"next number's size unread", {{"20240305.wq5", 101}, {"20240305.1.wq5", 101}}, 0, 100, "20240305.2.wq5"},
        {"leading zeros", {{"20240305.007.wq5", 10}}, 0, 100, "20240305.7.wq5"},
        {"other days never count", {{"20240304.5.wq5", 10}, {"20240306.7.wq5", 10}}, 0, 100, "20240305.wq5"},
        {"malformed names count as 0", {{"20240305.1.2.wq5", 10}, {"20240305.9.wq5.bak", 10}}, 0, 100, "20240305.wq5"},
        {"a number past INT_MAX counts as 0", {{"20240305.2147483648.wq5", 10}}, 0, 100, "20240305.wq5"},
        {"INT_MAX has no successor", {{"20240305.2147483647.wq5", 101}}, 0, 100, "20240305.2147483647.wq5"},
        {"1 MB, one byte over", {{"20240305.wq5", MB + 1}}, 1, 0, "20240305.1.wq5"},
        {"1 MB exactly", {{"20240305.wq5", MB}}, 1, 0, "20240305.wq5"},
        {"2048 MB, one byte over 2 GiB", {{"20240305.wq5", 2048 * MB + 1}}, 2048, 0, "20240305.1.wq5"},
        {"4096 MB, a 3 GiB file", {{"20240305.wq5", 3072 * MB}}, 4096, 0, "20240305.wq5"},
        {"a huge limit saturates", {{"20240305.wq5", 3072 * MB}}, LONG_MAX, 0, "20240305.wq5"},
        {"a negative limit is none", {{"20240305.wq5", 3072 * MB}}, -1, 0, "20240305.wq5"}};
    for (const auto& r : rows) {
        TempDir dir;
        makeFiles(dir, r.files);
        for (const std::string& spelling : {dir.path, dir.path + "/"}) {
            DataWriter writer(spelling, "wq5", 7, r.mb);
            if (r.bytes != 0)
                writer.setMaxSizeBytes(r.bytes);
            std::string name;
            writer.getLogfileName(MAR05, name);
            EXPECT_EQ(dir / r.expected, name) << r.what << ", directory <" << spelling << ">";
        }
    }
}

TEST(LogfileName, NamingAndRetentionTraceEveryStep)
{
    TempDir dir;
    makeFiles(dir, {{"20240226.wq5", 1}, {"20240305.1.wq5", 0}, {"20240305.3.wq5", 0}});
    ASSERT_EQ(0, mkdir((dir / "20240101.wq5").c_str(), 0755));
    TraceCapture capture(ALL_CLASSES);
    char numbered[] = "log/20240305.12.wq5", unnumbered[] = "log/20240305.wq5";
    parseSeq(numbered, "wq5");
    parseSeq(unnumbered, "wq5");
    char boundaries[80];
    snprintf(boundaries, sizeof(boundaries), "Boundaries %lx<1> %lx<\\x00>",
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(numbered + 13)),
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(numbered + 15)));
    EXPECT_EQ((std::vector<std::string>{"Parsing: log/20240305.12.wq5", "Found start: 12.wq5", boundaries,
                                        "End trimmed: 12", "Sequence: 12", "Parsing: log/20240305.wq5",
                                        "Found start: wq5"}),
              traced(capture, "parseSeq"));

    std::string name;
    DataWriter(dir.path, "wq5", 7, 0).getLogfileName(MAR05, name);
    DataWriter(dir / "absent", "wq5", 7, 0).getLogfileName(MAR05, name);
    EXPECT_EQ((std::vector<std::string>{"Found 2 logs for this period", "Latest sequence number: 3",
                                        "Logfile: " + dir / "20240305.3.wq5", "Latest sequence number: 0",
                                        "Logfile: " + dir / "absent/20240305.wq5"}),
              traced(capture, "DataWriter::getLogfileName"));
    EXPECT_FALSE(fs::exists(dir / "absent")) << "naming creates no directory";

    DataWriter(dir.path, "wq5", 7, 0).deleteOldFiles(MAR05);
    DataWriter(dir / "absent", "wq5", 7, 0).deleteOldFiles(MAR05);  // quietly nothing
    std::vector<std::string> retention = traced(capture, "DataWriter::deleteOldFiles");
    std::sort(retention.begin() + std::min<size_t>(1, retention.size()), retention.end());  // directory order
    EXPECT_EQ((std::vector<std::string>{"Threshold <20240227>", "Checking <20240226.wq5>", "Checking <20240305.1.wq5>",
                                        "Checking <20240305.3.wq5>", "Removing <" + dir / "20240226.wq5" + ">"}),
              retention);
}

TEST(DeleteOldFiles, RemovesLogFilesWhoseNameSortsBeforeTheThresholdDay)
{
    // Besides: a directory 20240101.wq5, a link 20240102.wq5 to target.txt, a dangling link 20240103.wq5.
    const Files files = {{"20231231.wq5", 1}, {"20240226.wq5", 1},    {"20240226.4.wq5", 1},  {"20240227.wq5", 1},
                         {"20240227.3.wq5", 1}, {"20240303.wq5", 1},  {"20240304.wq5", 1},    {"20240304.1.wq5", 1},
                         {"20240305.wq5", 1},   {"20240226.wq5.gz", 1}, {"20240226.log", 1}, {"20240226", 1},
                         {"notes.wq5", 1},      {"0.wq5", 1},         {"20240226-old.wq5", 1}, {".wq5", 1},
                         {"target.txt", 1}};
    const std::set<std::string> week = {"20231231.wq5", "20240226.wq5", "20240226.4.wq5", "0.wq5",
                                        "20240226-old.wq5", ".wq5", "20240102.wq5"};
    std::set<std::string> day = week;
    day.insert({"20240227.wq5", "20240227.3.wq5", "20240303.wq5"});
    const struct { long keepDays; std::set<std::string> removed; } rows[] = {
        {7, week}, {1, day}, {0, {}}, {-1, {}}, {LONG_MAX, {}},  // LONG_MAX days: a threshold out of range
        {44643, {"0.wq5", ".wq5"}}};                            // threshold in December 1901
    for (const auto& r : rows) {
        TempDir dir;
        makeFiles(dir, files);
        ASSERT_EQ(0, mkdir((dir / "20240101.wq5").c_str(), 0755));
        ASSERT_EQ(0, symlink("target.txt", (dir / "20240102.wq5").c_str()));
        ASSERT_EQ(0, symlink("nowhere.txt", (dir / "20240103.wq5").c_str()));
        std::set<std::string> expected = {"20240101.wq5", "20240102.wq5", "20240103.wq5"}, left;
        for (const auto& f : files)
            expected.insert(f.first);
        for (const std::string& name : r.removed)
            expected.erase(name);
        DataWriter(dir.path, "wq5", r.keepDays, 0).deleteOldFiles(MAR05);
        for (const auto& f : listDir(dir.path))
            left.insert(f.first);
        EXPECT_EQ(expected, left) << "keep " << r.keepDays << " days";
    }
}

TEST(DataWriter, OpensRollsOverAndReopensAsTheDayAndTheFileRequire)
{
    struct Step { wq5_time_t at; std::string record; bool removeFileFirst = false; };
    const struct { const char* what; Files before; long mb; int64_t bytes; std::vector<Step> steps; Files after;
                   int opens; } rows[] = {
        {"the first record opens the day's file and prunes", {{"20240101.wq5", 1}}, 0, 0,
         {{NOON, "first\n"}, {NOON, "second\n"}}, {{"20240305.wq5", 13}}, 1},
        {"a restart appends to the day's latest file", {{"20240305.wq5", 0}, {"20240305.2.wq5", 7}}, 1, 0,
         {{NOON, "after\n"}}, {{"20240305.wq5", 0}, {"20240305.2.wq5", 13}}, 1},
        {"midnight starts the next day's file and prunes again", {{"20240227.wq5", 1}}, 0, 0,
         {{MAR05 + DAY - 1, "late\n"}, {MAR05 + DAY, "early!\n"}}, {{"20240305.wq5", 5}, {"20240306.wq5", 7}}, 2},
        {"a clock set back keeps the file; a forced reopen takes the earlier date", {}, 0, 10,
         {{MAR05 + DAY + 10, "a\n"}, {MAR05 + DAY - 10, "b\n"}, {MAR05 + DAY - 10, "0123456789\n"},
          {MAR05 + DAY - 10, "c\n"}}, {{"20240306.wq5", 15}, {"20240305.wq5", 2}}, 2},
        {"1 MB: the record passing the limit stays, the next starts number 1", {{"20240305.wq5", MB - 10}}, 1, 0,
         {{NOON, std::string(20, 'x')}, {NOON, "next\n"}}, {{"20240305.wq5", MB + 10}, {"20240305.1.wq5", 5}}, 2},
        {"a file of exactly the limit stays in use", {{"20240305.wq5", MB - 5}}, 1, 0,
         {{NOON, "abcd\n"}, {NOON, "more\n"}}, {{"20240305.wq5", MB + 5}}, 1},
        {"no limit: never rolls, grows past 2 GiB", {{"20240305.wq5", 3072 * MB}}, 0, 0,
         {{NOON, "one\n"}, {NOON, "two\n"}}, {{"20240305.wq5", 3072 * MB + 8}}, 1},
        {"numbers 1 and 3: 3 goes on, then 4", {{"20240305.1.wq5", 100}, {"20240305.3.wq5", 95}}, 0, 100,
         {{NOON, "12345678\n"}, {NOON, "four\n"}},
         {{"20240305.1.wq5", 100}, {"20240305.3.wq5", 104}, {"20240305.4.wq5", 5}}, 2},
        {"the first record at the epoch", {}, 0, 0, {{5, "a\n"}}, {{"19700101.wq5", 2}}, 1},
        {"a removed file is reopened", {}, 0, 0, {{NOON, "one\n"}, {NOON + 1, "two!\n", true}},
         {{"20240305.wq5", 5}}, 2},
        {"a removed file is reopened, under a limit", {}, 1, 0, {{NOON, "one\n"}, {NOON, "two!\n", true}},
         {{"20240305.wq5", 5}}, 2}};
    for (const auto& r : rows) {
        TempDir dir;
        makeFiles(dir, r.before);
        DataWriter writer(dir.path, "wq5", 7, r.mb);
        if (r.bytes != 0)
            writer.setMaxSizeBytes(r.bytes);
        TraceCapture capture(ALL_CLASSES);
        for (const Step& s : r.steps) {
            ASSERT_TRUE(!s.removeFileFirst || unlink((dir / "20240305.wq5").c_str()) == 0);
            g_now = s.at;
            EXPECT_TRUE(writeRecord(writer, s.record)) << r.what << ": " << s.record;
        }
        EXPECT_EQ(r.after, listDir(dir.path)) << r.what;
        EXPECT_EQ(r.opens, capture.count("opened successfully.")) << r.what;
    }
}

// Records are dropped while the log directory cannot be used, with one error
// message for the run of failures; the first record after `repair` gets through.
void expectDropsUntilRepaired(DataWriter& writer, const std::string& file, const std::function<void()>& repair)
{
    TraceCapture capture(ALL_CLASSES);
    for (int i = 0; i < 3; ++i) {
        g_now = g_now + 1;
        EXPECT_FALSE(writeRecord(writer, "lost\n")) << "record " << i;
    }
    EXPECT_EQ(1, capture.count("Error: Data file <" + file + "> cannot be opened"));
    EXPECT_TRUE(traced(capture, "DataWriter::deleteOldFiles").empty()) << "retention in a missing directory is quiet";
    EXPECT_FALSE(fs::exists(fs::path(file).parent_path())) << "the writer creates no directory";
    repair();
    EXPECT_TRUE(writeRecord(writer, "kept\n"));
    EXPECT_EQ(1, capture.count("Data file <" + file + "> opened successfully."));
    EXPECT_EQ("kept\n", readFile(file));
}

TEST(DataWriter, MissingRemovedOrUnusableDirectoryDropsRecordsUntilItIsBack)
{
    TempDir dir;
    const std::string log = dir / "log", file = log + "/20240305.wq5";
    g_now = NOON;
    DataWriter writer(log, "wq5", 7, 0);
    expectDropsUntilRepaired(writer, file, [&] { ASSERT_EQ(0, mkdir(log.c_str(), 0755)); });
    EXPECT_EQ(0, writer.checkAndOpen()) << "the file is open";
    ASSERT_EQ(0, unlink(file.c_str()));
    ASSERT_EQ(0, rmdir(log.c_str()));
    expectDropsUntilRepaired(writer, file, [&] { ASSERT_EQ(0, mkdir(log.c_str(), 0755)); });

    wq5test::writeFile(dir / "blocker", "");  // a directory below a regular file: no open, for root neither
    DataWriter blocked(dir / "blocker/log", "wq5", 7, 0);
    expectDropsUntilRepaired(blocked, dir / "blocker/log/20240305.wq5", [&] {
        ASSERT_EQ(0, unlink((dir / "blocker").c_str()));
        ASSERT_EQ(0, mkdir((dir / "blocker").c_str(), 0755));
        ASSERT_EQ(0, mkdir((dir / "blocker/log").c_str(), 0755));
    });
    DataWriter absent(dir / "absent", "wq5", 7, 0);
    EXPECT_EQ(-1, absent.checkAndOpen());
    EXPECT_EQ(-1, absent.checkAndOpen()) << "every record tries again";
}

TEST(DataWriter, FailedOpenRetriesAlsoWhenTheClockIsSetBack)
{
    TempDir dir;
    const std::string log = dir / "log";
    ASSERT_EQ(0, mkdir(log.c_str(), 0755));
    DataWriter writer(log, "wq5", 7, 0);
    g_now = MAR05 + DAY + 10;
    ASSERT_TRUE(writeRecord(writer, "a\n"));
    fs::remove_all(log);
    g_now = MAR05 + 2 * DAY + 10;  // the new day's open fails
    EXPECT_FALSE(writeRecord(writer, "lost\n"));
    ASSERT_EQ(0, mkdir(log.c_str(), 0755));
    g_now = MAR05 + 10;  // before the day of the last open file
    ASSERT_TRUE(writeRecord(writer, "b\n"));
    EXPECT_EQ("b\n", readFile(log + "/20240305.wq5"));
}

}  // namespace
