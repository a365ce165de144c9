// Log file naming, sequence numbers, the writer's rollover and reopen rules,
// and retention. Every test runs in its own temporary directory and steps a
// clock of its own over midnight instead of waiting for one.
#include "src/mdwriter.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "platform/moq.h"
#include "support/trace_capture.h"

namespace fs = std::filesystem;

namespace {

// 2024-03-05 00:00:00 UTC: 2024-01-01 is 1704067200, plus 31 + 29 + 4 days.
const wq5_time_t MAR05 = 1704067200 + 64 * 86400;
const wq5_time_t DAY = 86400;
const int ALL_CLASSES = TRC_DETAIL | TRC_INFO | TRC_FLOW | TRC_ERROR;

std::atomic<wq5_time_t> g_now{0};
wq5_time_t testClock()
{
    return g_now.load();
}

class TempDir {
public:
    TempDir()
    {
        std::string templ = (fs::temp_directory_path() / "mdwriter_XXXXXX").string();
        std::vector<char> buf(templ.begin(), templ.end());
        buf.push_back('\0');
        if (mkdtemp(buf.data()) == nullptr)
            ADD_FAILURE() << "mkdtemp failed: " << strerror(errno);
        m_path = buf.data();
    }
    ~TempDir()
    {
        std::error_code ec;
        fs::remove_all(m_path, ec);
    }
    const std::string& path() const { return m_path; }
    std::string operator/(const std::string& name) const { return m_path + "/" + name; }

private:
    std::string m_path;
};

void makeFile(const std::string& path, int64_t size = 0)
{
    std::ofstream(path).close();
    // Sparse: gigabyte files cost nothing.
    ASSERT_EQ(truncate(path.c_str(), static_cast<off_t>(size)), 0) << path;
}

std::string readFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

int64_t fileSize(const std::string& path)
{
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? static_cast<int64_t>(st.st_size) : -1;
}

std::set<std::string> listDir(const std::string& dir)
{
    std::set<std::string> names;
    for (const fs::directory_entry& e : fs::directory_iterator(dir))
        names.insert(e.path().filename().string());
    return names;
}

// The record writer's road: lock, stream, one write, unlock. False when the
// record was dropped.
bool writeRecord(DataWriter& writer, const std::string& record)
{
    DataWriterLock lock(writer);
    FILE* stream = lock.getStream();
    if (stream == nullptr)
        return false;
    return fwrite(record.data(), record.size(), 1, stream) == 1;
}

// True when some trace line holds `text` anywhere (for messages whose text
// is not at the end of the line).
bool traced(const TraceCapture& capture, const std::string& text)
{
    for (const std::string& line : capture.lines())
        if (line.find(text) != std::string::npos)
            return true;
    return false;
}

class ClockTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        g_now = MAR05 + 12 * 3600;
        setWriterClock(&testClock);
    }
    void TearDown() override { setWriterClock(nullptr); }
};

// ---------------------------------------------------------------------------
// Period and date

TEST_F(ClockTest, PeriodStartIsTheLatestUtcMidnight)
{
    struct Row {
        wq5_time_t now;
        wq5_time_t expected;
        const char* what;
    };
    const Row rows[] = {
        {MAR05, MAR05, "exactly midnight gives the time itself"},
        {MAR05 - 1, MAR05 - DAY, "23:59:59 belongs to the day before"},
        {MAR05 + DAY - 1, MAR05, "last second of the day"},
        {MAR05 + DAY, MAR05 + DAY, "next midnight"},
        {MAR05 + 12 * 3600 + 34, MAR05, "midday"},
        {0, 0, "the epoch"},
        {59, 0, "first minute of 1970"},
    };
    for (const Row& r : rows) {
        g_now = r.now;
        EXPECT_EQ(calcPeriodStart(DAY), r.expected) << r.what;
    }
}

TEST(Time2Str, UtcDateOrOutputUntouched)
{
    struct Row {
        wq5_time_t t;
        const char* expected;
        const char* what;
    };
    const Row rows[] = {
        {MAR05, "20240305", "midnight"},
        {MAR05 - 1, "20240304", "one second before"},
        {MAR05 + DAY - 1, "20240305", "end of the day"},
        {0, "19700101", "epoch"},
        {946684800 + 59 * DAY, "20000229", "leap day 2000"},
        {INT64_MAX, "keep", "cannot be broken down"},
        // Year about 1.27e9: ten digits do not fit the 13-character buffer.
        {40000000000000000LL, "keep", "year too long for the buffer"},
    };
    for (const Row& r : rows) {
        std::string out = "keep";
        time2str(r.t, out);
        EXPECT_EQ(out, r.expected) << r.what << " t=" << r.t;
    }
}

// ---------------------------------------------------------------------------
// Sequence numbers

TEST(ParseSeq, NamesThatCarryANumber)
{
    struct Row {
        const char* path;
        int expected;
    };
    const Row rows[] = {
        {"log/20240305.12.wq5", 12},
        {"log/20240305.007.wq5", 7},
        {"log/20240305.1.wq5", 1},
        {"20240305.5.wq5", 5},
        {"/abs/dir.d/20240305.3.wq5", 3},
        {"log/anything.9.wq5", 9},
        {"log/20240305.2147483647.wq5", INT_MAX},
        {"log/20240305.000000000000000000042.wq5", 42},
    };
    for (const Row& r : rows) {
        std::string path = r.path;
        EXPECT_EQ(parseSeq(&path[0], "wq5"), r.expected) << r.path;
        EXPECT_EQ(path, r.path) << "not restored: " << r.path;
    }
}

TEST(ParseSeq, NamesWithoutANumberGiveZero)
{
    const char* rows[] = {
        "log/20240305.wq5",             // unnumbered
        "log/20240305.1.2.wq5",         // two numbers
        "log/20240305..wq5",            // no digit
        "log/20240305.1a.wq5",          // not only digits
        "log/20240305.3.log",           // other suffix
        "log/20240305.3.WQ5",           // suffix differs in case
        "log/20240305.3.wq5.bak",       // suffix not last
        "log/20240305.3.wq",            // suffix cut short
        "log/20240305.3.",              // nothing after the second dot
        "log/20240305.3",               // no second dot
        "log/20240305",                 // no dot at all
        "log.d/20240305",               // dot only in the directory
        "log/20240305.-1.wq5",          // sign
        "log/20240305.+1.wq5",          // sign
        "log/20240305. 1.wq5",          // blank
        "log/20240305.2147483648.wq5",  // one past INT_MAX
        "log/20240305.99999999999.wq5", // far past INT_MAX
        "",                             // empty
        "wq5",                          // suffix alone
        ".wq5",                         // dot and suffix
    };
    for (const char* name : rows) {
        std::string path = name;
        EXPECT_EQ(parseSeq(&path[0], "wq5"), 0) << "'" << name << "'";
        EXPECT_EQ(path, name) << "not restored: " << name;
    }
}

TEST(ParseSeq, TracesEachStep)
{
    TraceCapture capture(ALL_CLASSES);
    char path[] = "log/20240305.12.wq5";
    ASSERT_EQ(parseSeq(path, "wq5"), 12);

    EXPECT_EQ(capture.count("Parsing: log/20240305.12.wq5"), 1);
    EXPECT_EQ(capture.count("Found start: 12.wq5"), 1);
    char boundaries[128];
    snprintf(boundaries, sizeof boundaries, "Boundaries %lx<1> %lx<",
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(path + 13)),
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(path + 15)));
    EXPECT_TRUE(traced(capture, boundaries)) << boundaries;
    EXPECT_EQ(capture.count("End trimmed: 12"), 1);
    EXPECT_EQ(capture.count("Sequence: 12"), 1);

    EXPECT_LT(capture.indexOf("Parsing: log/20240305.12.wq5"), capture.indexOf("Found start: 12.wq5"));
    EXPECT_LT(capture.indexOf("End trimmed: 12"), capture.indexOf("Sequence: 12"));
}

TEST(ParseSeq, UnnumberedNameTracesOnlyUpToTheStart)
{
    TraceCapture capture(ALL_CLASSES);
    char path[] = "log/20240305.wq5";
    EXPECT_EQ(parseSeq(path, "wq5"), 0);
    EXPECT_EQ(capture.count("Parsing: log/20240305.wq5"), 1);
    EXPECT_EQ(capture.count("Found start: wq5"), 1);
    EXPECT_FALSE(traced(capture, "Sequence:"));
}

// ---------------------------------------------------------------------------
// Naming

struct ExistingFile {
    const char* name;
    int64_t size;
};

struct NamingRow {
    const char* what;
    std::vector<ExistingFile> files;
    int64_t limitBytes;  // 0 = no limit
    const char* expected;
};

TEST(GetLogfileName, PicksTheDaysLatestFileOrTheNextNumber)
{
    const NamingRow rows[] = {
        {"no file of the day", {}, 100, "20240305.wq5"},
        {"unnumbered within the limit", {{"20240305.wq5", 50}}, 100, "20240305.wq5"},
        {"unnumbered exactly at the limit", {{"20240305.wq5", 100}}, 100, "20240305.wq5"},
        {"unnumbered over the limit", {{"20240305.wq5", 101}}, 100, "20240305.1.wq5"},
        {"unnumbered large, no limit", {{"20240305.wq5", 1 << 20}}, 0, "20240305.wq5"},
        {"1 and 3, 3 within", {{"20240305.wq5", 101}, {"20240305.1.wq5", 101}, {"20240305.3.wq5", 10}}, 100,
         "20240305.3.wq5"},
        {"1 and 3, 3 over", {{"20240305.1.wq5", 101}, {"20240305.3.wq5", 101}}, 100, "20240305.4.wq5"},
        {"numbered large, no limit", {{"20240305.2.wq5", 1 << 20}}, 0, "20240305.2.wq5"},
        {"leading zeros", {{"20240305.007.wq5", 10}}, 100, "20240305.7.wq5"},
        {"other days never count", {{"20240304.5.wq5", 10}, {"20240306.7.wq5", 10}}, 100, "20240305.wq5"},
        {"backup not matched", {{"20240305.9.wq5.bak", 10}}, 100, "20240305.wq5"},
        {"malformed names count as 0", {{"20240305.1.2.wq5", 10}, {"20240305-old.wq5", 10}}, 100, "20240305.wq5"},
        {"number past INT_MAX counts as 0", {{"20240305.2147483648.wq5", 10}}, 100, "20240305.wq5"},
        {"INT_MAX over the limit has no successor", {{"20240305.2147483647.wq5", 101}}, 100,
         "20240305.2147483647.wq5"},
        {"next number's size is not looked at", {{"20240305.wq5", 101}, {"20240305.1.wq5", 101}}, 100,
         "20240305.2.wq5"},
    };
    for (const NamingRow& r : rows) {
        TempDir dir;
        for (const ExistingFile& f : r.files)
            makeFile(dir / f.name, f.size);
        DataWriter writer(dir.path(), "wq5", 7, 0);
        writer.setMaxSizeBytes(r.limitBytes);
        std::string name;
        writer.getLogfileName(MAR05, name);
        EXPECT_EQ(name, dir / r.expected) << r.what;
    }
}

TEST(GetLogfileName, LimitInMegabytesIsSixtyFourBit)
{
    const int64_t MB = 1048576;
    const int64_t GB = 1024 * MB;
    struct Row {
        const char* what;
        long limitMb;
        int64_t size;
        const char* expected;
    };
    const Row rows[] = {
        {"1 MB, one byte over", 1, MB + 1, "20240305.1.wq5"},
        {"1 MB, exactly", 1, MB, "20240305.wq5"},
        {"2048 MB, one byte over 2 GiB", 2048, 2 * GB + 1, "20240305.1.wq5"},
        {"4096 MB, 3 GiB file", 4096, 3 * GB, "20240305.wq5"},
        {"limit saturates instead of wrapping", LONG_MAX, 3 * GB, "20240305.wq5"},
        {"negative limit is none", -1, 3 * GB, "20240305.wq5"},
    };
    for (const Row& r : rows) {
        TempDir dir;
        makeFile(dir / "20240305.wq5", r.size);
        DataWriter writer(dir.path(), "wq5", 7, r.limitMb);
        std::string name;
        writer.getLogfileName(MAR05, name);
        EXPECT_EQ(name, dir / r.expected) << r.what;
    }
}

TEST(GetLogfileName, TrailingSlashMakesNoDifference)
{
    TempDir dir;
    makeFile(dir / "20240305.wq5", 0);
    makeFile(dir / "20240305.2.wq5", 0);
    DataWriter bare(dir.path(), "wq5", 7, 0);
    DataWriter slashed(dir.path() + "/", "wq5", 7, 0);
    std::string a, b;
    bare.getLogfileName(MAR05, a);
    slashed.getLogfileName(MAR05, b);
    EXPECT_EQ(a, dir / "20240305.2.wq5");
    EXPECT_EQ(b, a);
}

TEST(GetLogfileName, MissingDirectoryGivesTheUnnumberedName)
{
    TempDir dir;
    TraceCapture capture(ALL_CLASSES);
    DataWriter writer(dir / "absent", "wq5", 7, 1);
    std::string name;
    writer.getLogfileName(MAR05, name);
    EXPECT_EQ(name, dir / "absent/20240305.wq5");
    EXPECT_FALSE(traced(capture, "logs for this period"));
    EXPECT_EQ(capture.count("Latest sequence number: 0"), 1);
    EXPECT_FALSE(fs::exists(dir / "absent")) << "the directory must not be created";
}

TEST(GetLogfileName, TracesCountLatestAndName)
{
    TempDir dir;
    makeFile(dir / "20240305.wq5", 0);
    makeFile(dir / "20240305.1.wq5", 0);
    makeFile(dir / "20240305.3.wq5", 0);
    DataWriter writer(dir.path(), "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);
    std::string name;
    writer.getLogfileName(MAR05, name);

    const std::string logfile = "Logfile: " + dir / "20240305.3.wq5";
    EXPECT_EQ(capture.count("Found 3 logs for this period"), 1);
    EXPECT_EQ(capture.count("Latest sequence number: 3"), 1);
    EXPECT_EQ(capture.count(logfile), 1);
    EXPECT_LT(capture.indexOf("Found 3 logs for this period"), capture.indexOf("Latest sequence number: 3"));
    EXPECT_LT(capture.indexOf("Latest sequence number: 3"), capture.indexOf(logfile));
}

TEST(GetLogfileName, EmptyDirectoryMeansWorkingDirectory)
{
    DataWriter writer("", "wq5", 7, 0);
    std::string name;
    // A date far from today: nothing in the working directory matches.
    writer.getLogfileName(0, name);
    EXPECT_EQ(name, "./19700101.wq5");
}

// ---------------------------------------------------------------------------
// Retention

// Every file of the retention table, created afresh for each row.
const char* const RETENTION_FILES[] = {
    "20231231.wq5",      "20240226.wq5",   "20240226.4.wq5", "20240227.wq5",     "20240227.3.wq5",
    "20240303.wq5",      "20240304.wq5",   "20240304.1.wq5", "20240305.wq5",     "20240226.wq5.gz",
    "20240226.log",      "20240226",       "notes.wq5",      "0.wq5",            "20240226-old.wq5",
    ".wq5",              "target.txt",
};
// Made as a subdirectory, a link to target.txt and a dangling link.
const char* const RETENTION_SUBDIR = "20240101.wq5";
const char* const RETENTION_LINK = "20240102.wq5";
const char* const RETENTION_DANGLING = "20240103.wq5";

struct RetentionRow {
    const char* what;
    long keepDays;
    std::set<std::string> survivors;
};

TEST(DeleteOldFiles, KeepsTheConfiguredDaysByName)
{
    // Expected survivors, by hand: a file goes when the threshold date sorts
    // after its whole name and its last extension is exactly "wq5".
    const std::set<std::string> all = {
        "20231231.wq5",  "20240226.wq5", "20240226.4.wq5",  "20240227.wq5",     "20240227.3.wq5", "20240303.wq5",
        "20240304.wq5",  "20240304.1.wq5", "20240305.wq5",  "20240226.wq5.gz",  "20240226.log",   "20240226",
        "notes.wq5",     "0.wq5",        "20240226-old.wq5", ".wq5",            "target.txt",     "20240101.wq5",
        "20240102.wq5",  "20240103.wq5",
    };
    const RetentionRow rows[] = {
        {"7 days: threshold 20240227",
         7,
         {"20240227.wq5", "20240227.3.wq5", "20240303.wq5", "20240304.wq5", "20240304.1.wq5", "20240305.wq5",
          "20240226.wq5.gz", "20240226.log", "20240226", "notes.wq5", "target.txt", "20240101.wq5",
          "20240103.wq5"}},
        {"1 day: threshold 20240304",
         1,
         {"20240304.wq5", "20240304.1.wq5", "20240305.wq5", "20240226.wq5.gz", "20240226.log", "20240226",
          "notes.wq5", "target.txt", "20240101.wq5", "20240103.wq5"}},
        {"0 days keeps everything", 0, all},
        {"-1 days keeps everything", -1, all},
        // 44643 days before 2024 is late 1901/early 1902: every dated name
        // stays; only names sorting before "19" go.
        {"44643 days: threshold in 1901/1902",
         44643,
         {"20231231.wq5", "20240226.wq5", "20240226.4.wq5", "20240227.wq5", "20240227.3.wq5", "20240303.wq5",
          "20240304.wq5", "20240304.1.wq5", "20240305.wq5", "20240226.wq5.gz", "20240226.log", "20240226",
          "notes.wq5", "20240226-old.wq5", "target.txt", "20240101.wq5", "20240102.wq5", "20240103.wq5"}},
        {"threshold out of range keeps everything", LONG_MAX, all},
    };
    for (const RetentionRow& r : rows) {
        TempDir dir;
        for (const char* name : RETENTION_FILES)
            makeFile(dir / name, 1);
        ASSERT_EQ(mkdir((dir / RETENTION_SUBDIR).c_str(), 0755), 0);
        ASSERT_EQ(symlink("target.txt", (dir / RETENTION_LINK).c_str()), 0);
        ASSERT_EQ(symlink("nowhere.txt", (dir / RETENTION_DANGLING).c_str()), 0);

        DataWriter writer(dir.path(), "wq5", r.keepDays, 0);
        writer.deleteOldFiles(MAR05);
        EXPECT_EQ(listDir(dir.path()), r.survivors) << r.what;
    }
}

TEST(DeleteOldFiles, TracesThresholdCheckedNamesAndRemovedPaths)
{
    TempDir dir;
    makeFile(dir / "20240226.wq5", 1);
    makeFile(dir / "20240305.wq5", 1);
    makeFile(dir / "notes.txt", 1);
    ASSERT_EQ(mkdir((dir / "20240101.wq5").c_str(), 0755), 0);
    DataWriter writer(dir.path(), "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);
    writer.deleteOldFiles(MAR05);

    EXPECT_EQ(capture.count("Threshold <20240227>"), 1);
    EXPECT_EQ(capture.count("Checking <20240226.wq5>"), 1);
    EXPECT_EQ(capture.count("Checking <20240305.wq5>"), 1);
    EXPECT_EQ(capture.count("Checking <notes.txt>"), 1);
    EXPECT_EQ(capture.count("Checking <20240101.wq5>"), 0) << "directories are not checked";
    EXPECT_EQ(capture.count("Removing <" + dir / "20240226.wq5" + ">"), 1);
    EXPECT_EQ(capture.count("Removing <" + dir / "20240305.wq5" + ">"), 0);
}

TEST(DeleteOldFiles, MissingDirectoryOrNoRetentionDoesNothingQuietly)
{
    TempDir dir;
    TraceCapture capture(ALL_CLASSES);
    DataWriter missing(dir / "absent", "wq5", 7, 0);
    missing.deleteOldFiles(MAR05);
    makeFile(dir / "20200101.wq5", 1);
    DataWriter disabled(dir.path(), "wq5", 0, 0);
    disabled.deleteOldFiles(MAR05);

    EXPECT_TRUE(capture.lines().empty()) << capture.lines().front();
    EXPECT_TRUE(fs::exists(dir / "20200101.wq5"));
    EXPECT_FALSE(fs::exists(dir / "absent"));
}

// ---------------------------------------------------------------------------
// Writer: opening and rollover

TEST_F(ClockTest, FirstRecordOpensTheDaysFileAndPrunesOnce)
{
    TempDir dir;
    makeFile(dir / "20240101.wq5", 1);
    DataWriter writer(dir.path(), "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);

    EXPECT_TRUE(fs::exists(dir / "20240101.wq5")) << "the constructor opens and prunes nothing";
    ASSERT_TRUE(writeRecord(writer, "first\n"));
    ASSERT_TRUE(writeRecord(writer, "second\n"));

    EXPECT_EQ(readFile(dir / "20240305.wq5"), "first\nsecond\n");
    EXPECT_FALSE(fs::exists(dir / "20240101.wq5"));
    EXPECT_EQ(capture.count("Threshold <20240227>"), 1) << "pruned once";
    EXPECT_EQ(capture.count("Data file <" + dir / "20240305.wq5" + "> opened successfully."), 1);
}

TEST_F(ClockTest, RestartOnTheSameDayAppendsToTheLatestFile)
{
    TempDir dir;
    makeFile(dir / "20240305.wq5", 0);
    {
        std::ofstream(dir / "20240305.2.wq5") << "before\n";
    }
    DataWriter writer(dir.path(), "wq5", 7, 1);
    ASSERT_TRUE(writeRecord(writer, "after\n"));
    EXPECT_EQ(readFile(dir / "20240305.2.wq5"), "before\nafter\n");
}

TEST_F(ClockTest, MidnightStartsTheNextDaysFile)
{
    TempDir dir;
    DataWriter writer(dir.path(), "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);

    g_now = MAR05 + DAY - 1;  // 2024-03-05 23:59:59
    ASSERT_TRUE(writeRecord(writer, "late\n"));
    g_now = MAR05 + DAY;  // 2024-03-06 00:00:00
    ASSERT_TRUE(writeRecord(writer, "early\n"));

    EXPECT_EQ(readFile(dir / "20240305.wq5"), "late\n");
    EXPECT_EQ(readFile(dir / "20240306.wq5"), "early\n");
    EXPECT_EQ(listDir(dir.path()), (std::set<std::string>{"20240305.wq5", "20240306.wq5"}));
    EXPECT_EQ(capture.count("Threshold <20240227>"), 1);
    EXPECT_EQ(capture.count("Threshold <20240228>"), 1);
}

TEST_F(ClockTest, ClockSetBackKeepsTheCurrentFile)
{
    TempDir dir;
    DataWriter writer(dir.path(), "wq5", 7, 0);
    writer.setMaxSizeBytes(10);

    g_now = MAR05 + DAY + 10;  // 2024-03-06 00:00:10
    ASSERT_TRUE(writeRecord(writer, "a\n"));
    g_now = MAR05 + DAY - 10;  // back to 2024-03-05 23:59:50
    ASSERT_TRUE(writeRecord(writer, "b\n"));
    EXPECT_EQ(readFile(dir / "20240306.wq5"), "a\nb\n");
    EXPECT_FALSE(fs::exists(dir / "20240305.wq5"));

    // The limit forces a reopen while the clock is back: the new file
    // carries the earlier date.
    ASSERT_TRUE(writeRecord(writer, "0123456789\n"));
    ASSERT_TRUE(writeRecord(writer, "c\n"));
    EXPECT_EQ(readFile(dir / "20240306.wq5"), "a\nb\n0123456789\n");
    EXPECT_EQ(readFile(dir / "20240305.wq5"), "c\n");
}

TEST_F(ClockTest, OneMegabyteLimitRollsAfterTheRecordThatPassesIt)
{
    const int64_t LIMIT = 1048576;
    TempDir dir;
    makeFile(dir / "20240305.wq5", LIMIT - 10);
    DataWriter writer(dir.path(), "wq5", 7, 1);

    const std::string record(20, 'x');
    ASSERT_TRUE(writeRecord(writer, record));  // passes the limit, still here
    EXPECT_EQ(fileSize(dir / "20240305.wq5"), LIMIT + 10);
    ASSERT_TRUE(writeRecord(writer, "next\n"));
    EXPECT_EQ(readFile(dir / "20240305.1.wq5"), "next\n");
    EXPECT_EQ(fileSize(dir / "20240305.wq5"), LIMIT + 10);
}

TEST_F(ClockTest, FileOfExactlyTheLimitStaysInUse)
{
    const int64_t LIMIT = 1048576;
    TempDir dir;
    makeFile(dir / "20240305.wq5", LIMIT - 5);
    DataWriter writer(dir.path(), "wq5", 7, 1);

    ASSERT_TRUE(writeRecord(writer, "abcd\n"));
    EXPECT_EQ(fileSize(dir / "20240305.wq5"), LIMIT);
    ASSERT_TRUE(writeRecord(writer, "more\n"));
    EXPECT_EQ(fileSize(dir / "20240305.wq5"), LIMIT + 5);
    EXPECT_FALSE(fs::exists(dir / "20240305.1.wq5"));
}

TEST_F(ClockTest, NoLimitNeverRollsAndFilesGrowPastTwoGigabytes)
{
    const int64_t SIZE = int64_t(3) << 30;
    TempDir dir;
    makeFile(dir / "20240305.wq5", SIZE);
    DataWriter writer(dir.path(), "wq5", 7, 0);

    ASSERT_TRUE(writeRecord(writer, "one\n"));
    ASSERT_TRUE(writeRecord(writer, "two\n"));
    EXPECT_EQ(fileSize(dir / "20240305.wq5"), SIZE + 8);
    EXPECT_EQ(listDir(dir.path()), std::set<std::string>{"20240305.wq5"});

    std::ifstream in(dir / "20240305.wq5", std::ios::binary);
    in.seekg(SIZE);
    std::string tail((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    EXPECT_EQ(tail, "one\ntwo\n");
}

TEST_F(ClockTest, NumbersOneAndThreeContinueWithThreeThenFour)
{
    TempDir dir;
    makeFile(dir / "20240305.1.wq5", 100);
    makeFile(dir / "20240305.3.wq5", 95);
    DataWriter writer(dir.path(), "wq5", 7, 0);
    writer.setMaxSizeBytes(100);

    ASSERT_TRUE(writeRecord(writer, "12345678\n"));  // 3 reaches 104
    ASSERT_TRUE(writeRecord(writer, "four\n"));
    EXPECT_EQ(fileSize(dir / "20240305.3.wq5"), 104);
    EXPECT_EQ(readFile(dir / "20240305.4.wq5"), "four\n");
    EXPECT_FALSE(fs::exists(dir / "20240305.2.wq5")) << "gaps are not filled";
}

// ---------------------------------------------------------------------------
// Writer: failures and recovery

TEST_F(ClockTest, MissingDirectoryDropsRecordsUntilItExists)
{
    TempDir dir;
    const std::string logDir = dir / "log";
    const std::string error = "Error: Data file <" + logDir + "/20240305.wq5> cannot be opened";
    const std::string opened = "Data file <" + logDir + "/20240305.wq5> opened successfully.";
    DataWriter writer(logDir, "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);

    for (int i = 0; i < 3; ++i)
        EXPECT_FALSE(writeRecord(writer, "lost\n")) << "record " << i;
    EXPECT_EQ(capture.count(error), 1);
    EXPECT_FALSE(fs::exists(logDir)) << "the writer never creates the directory";

    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    ASSERT_TRUE(writeRecord(writer, "kept\n"));
    EXPECT_EQ(capture.count(opened), 1);
    EXPECT_EQ(readFile(logDir + "/20240305.wq5"), "kept\n");

    // A new run of failures is reported once again.
    ASSERT_EQ(unlink((logDir + "/20240305.wq5").c_str()), 0);
    ASSERT_EQ(rmdir(logDir.c_str()), 0);
    g_now = g_now + 1;
    EXPECT_FALSE(writeRecord(writer, "lost\n"));
    EXPECT_FALSE(writeRecord(writer, "lost\n"));
    EXPECT_EQ(capture.count(error), 2);
}

TEST_F(ClockTest, CheckAndOpenReturnsMinusOneOnlyForAFailedOpen)
{
    // Single-threaded: calling it directly stands in for the lock's call.
    TempDir dir;
    DataWriter missing(dir / "absent", "wq5", 7, 0);
    EXPECT_EQ(missing.checkAndOpen(), -1);
    EXPECT_EQ(missing.checkAndOpen(), -1) << "every record retries";

    DataWriter present(dir.path(), "wq5", 7, 0);
    EXPECT_EQ(present.checkAndOpen(), 0) << "successful open";
    EXPECT_EQ(present.checkAndOpen(), 0) << "file already open";
}

TEST_F(ClockTest, UnwritableDirectoryDropsRecordsUntilItIsUsable)
{
    // The parent is a regular file: no open can succeed, root or not.
    TempDir dir;
    makeFile(dir / "blocker", 0);
    const std::string logDir = dir / "blocker/log";
    DataWriter writer(logDir, "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);

    EXPECT_FALSE(writeRecord(writer, "lost\n"));
    EXPECT_FALSE(writeRecord(writer, "lost\n"));
    EXPECT_EQ(capture.count("Error: Data file <" + logDir + "/20240305.wq5> cannot be opened"), 1);

    ASSERT_EQ(unlink((dir / "blocker").c_str()), 0);
    ASSERT_EQ(mkdir((dir / "blocker").c_str(), 0755), 0);
    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    ASSERT_TRUE(writeRecord(writer, "kept\n"));
    EXPECT_EQ(capture.count("Data file <" + logDir + "/20240305.wq5> opened successfully."), 1);
    EXPECT_EQ(readFile(logDir + "/20240305.wq5"), "kept\n");
}

TEST_F(ClockTest, FailedOpenRetriesAlsoWhenTheClockIsSetBack)
{
    TempDir dir;
    const std::string logDir = dir / "log";
    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    DataWriter writer(logDir, "wq5", 7, 0);

    g_now = MAR05 + DAY + 10;  // 2024-03-06
    ASSERT_TRUE(writeRecord(writer, "a\n"));
    ASSERT_EQ(unlink((logDir + "/20240306.wq5").c_str()), 0);
    ASSERT_EQ(rmdir(logDir.c_str()), 0);
    g_now = MAR05 + 2 * DAY + 10;  // 2024-03-07: the new day's open fails
    EXPECT_FALSE(writeRecord(writer, "lost\n"));

    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    g_now = MAR05 + 10;  // back to 2024-03-05, before the last open day
    ASSERT_TRUE(writeRecord(writer, "b\n"));
    EXPECT_EQ(readFile(logDir + "/20240305.wq5"), "b\n");
}

TEST_F(ClockTest, FirstRecordAtTheEpochOpensToo)
{
    TempDir dir;
    DataWriter writer(dir.path(), "wq5", 7, 0);
    g_now = 5;
    ASSERT_TRUE(writeRecord(writer, "a\n"));
    EXPECT_EQ(readFile(dir / "19700101.wq5"), "a\n");
}

TEST_F(ClockTest, RemovedFileIsReopenedWithinASecond)
{
    TempDir dir;
    const std::string file = dir / "20240305.wq5";
    DataWriter writer(dir.path(), "wq5", 7, 0);

    ASSERT_TRUE(writeRecord(writer, "one\n"));
    ASSERT_EQ(unlink(file.c_str()), 0);
    g_now = g_now + 1;
    ASSERT_TRUE(writeRecord(writer, "two\n"));
    EXPECT_EQ(readFile(file), "two\n");
}

TEST_F(ClockTest, RemovedFileIsReopenedAtOnceUnderALimit)
{
    TempDir dir;
    const std::string file = dir / "20240305.wq5";
    DataWriter writer(dir.path(), "wq5", 7, 1);

    ASSERT_TRUE(writeRecord(writer, "one\n"));
    ASSERT_EQ(unlink(file.c_str()), 0);
    ASSERT_TRUE(writeRecord(writer, "two\n"));
    EXPECT_EQ(readFile(file), "two\n");
}

TEST_F(ClockTest, RemovedDirectoryIsReportedOnceAndRecoveredFrom)
{
    TempDir dir;
    const std::string logDir = dir / "log";
    const std::string file = logDir + "/20240305.wq5";
    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    DataWriter writer(logDir, "wq5", 7, 0);
    TraceCapture capture(ALL_CLASSES);

    ASSERT_TRUE(writeRecord(writer, "one\n"));
    ASSERT_EQ(unlink(file.c_str()), 0);
    ASSERT_EQ(rmdir(logDir.c_str()), 0);
    for (int i = 0; i < 3; ++i) {
        g_now = g_now + 1;
        EXPECT_FALSE(writeRecord(writer, "lost\n")) << "record " << i;
    }
    EXPECT_EQ(capture.count("Error: Data file <" + file + "> cannot be opened"), 1);

    ASSERT_EQ(mkdir(logDir.c_str(), 0755), 0);
    ASSERT_TRUE(writeRecord(writer, "back\n"));
    EXPECT_EQ(capture.count("Data file <" + file + "> opened successfully."), 2);
    EXPECT_EQ(readFile(file), "back\n");
}

}  // namespace
