// Values that do not fit in 32 bits, through the real writer: log files over
// 2 GiB appended to and rolled over under a limit above 2 GiB, and days
// after January 2038 (2^31 seconds) and February 2106 (2^32). The 64-bit
// build passes them as a matter of course; they are here for the 32-bit one.
#include "src/mdwriter.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>

#include "platform/moq.h"
#include "support/trace_capture.h"

static_assert(sizeof(time_t) == 8, "64-bit time (on i386: _TIME_BITS=64)");
static_assert(sizeof(off_t) == 8, "64-bit file offsets (on i386: _FILE_OFFSET_BITS=64)");

namespace fs = std::filesystem;

namespace {

const int64_t MiB = 1048576;
const wq5_time_t DAY = 86400;
// 2040-01-01 is day 25567 (70 years, 17 of them leap years), so 2040-02-29
// is day 25567 + 31 + 28. 2^31 s is 2038-01-19 03:14:08 UTC, in day 24855;
// 2^32 s is 2106-02-07 06:28:16 UTC, in day 49710.
const wq5_time_t FEB29_2040 = 25626 * DAY;
const wq5_time_t JAN19_2038 = 24855 * DAY;
const wq5_time_t FEB07_2106 = 49710 * DAY;

wq5_time_t g_now = 0;
wq5_time_t testClock() { return g_now; }

class Beyond32 : public ::testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/beyond32.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        m_dir = pattern;
        g_now = FEB29_2040 + 12 * 3600;
        setWriterClock(&testClock);
    }
    void TearDown() override
    {
        setWriterClock(nullptr);
        fs::remove_all(m_dir);
    }
    // Empties the directory for the next row of a table.
    void reset() const
    {
        fs::remove_all(m_dir);
        fs::create_directory(m_dir);
    }
    // Sparse: gigabytes cost no disk space.
    void makeFile(const std::string& name, int64_t size) const
    {
        std::ofstream(m_dir / name).close();
        fs::resize_file(m_dir / name, static_cast<uintmax_t>(size));
    }
    int64_t sizeOf(const std::string& name) const { return static_cast<int64_t>(fs::file_size(m_dir / name)); }
    // Up to 100 bytes of the file from `offset` on.
    std::string bytesAt(const std::string& name, int64_t offset) const
    {
        std::ifstream in(m_dir / name, std::ios::binary);
        in.seekg(offset);
        char buffer[100];
        in.read(buffer, sizeof buffer);
        return std::string(buffer, static_cast<size_t>(in.gcount()));
    }
    std::set<std::string> names() const
    {
        std::set<std::string> all;
        for (const auto& e : fs::directory_iterator(m_dir))
            all.insert(e.path().filename().string());
        return all;
    }
    static bool write(DataWriter& writer, const std::string& record)
    {
        DataWriterLock lock(writer);
        FILE* stream = lock.getStream();
        return stream != nullptr && fwrite(record.data(), record.size(), 1, stream) == 1;
    }

    fs::path m_dir;
};

TEST_F(Beyond32, LargeFileTakesTheRecordOrRollsToTheNextNumber)
{
    struct Row {
        const char* what;
        long limitMb;
        int64_t size;        // of 20400229.wq5
        int64_t size2;       // of 20400229.2.wq5, if > 0
        const char* target;  // the file that receives the record
        int64_t before;      // its size before
    };
    const Row rows[] = {
        {"2 GiB + 1 KiB, no limit", 0, 2048 * MiB + 1024, 0, "20400229.wq5", 2048 * MiB + 1024},
        {"2.5 GiB under 3000 MB", 3000, 2560 * MiB, 0, "20400229.wq5", 2560 * MiB},
        {"exactly 3000 MiB under 3000 MB", 3000, 3000 * MiB, 0, "20400229.wq5", 3000 * MiB},
        {"3000 MiB + 1 over 3000 MB", 3000, 3000 * MiB + 1, 0, "20400229.1.wq5", 0},
        {"number 2 over 3000 MB", 3000, 10, 3000 * MiB + 1, "20400229.3.wq5", 0},
        {"4.5 GiB under 5000 MB", 5000, 4608 * MiB, 0, "20400229.wq5", 4608 * MiB},
    };
    const std::string record = "<hpage>v121^92^0^c^g^</hpage>\n";
    for (const Row& r : rows) {
        SCOPED_TRACE(r.what);
        reset();
        std::set<std::string> expected = {"20400229.wq5", r.target};
        makeFile("20400229.wq5", r.size);
        if (r.size2 > 0) {
            makeFile("20400229.2.wq5", r.size2);
            expected.insert("20400229.2.wq5");
        }
        DataWriter writer(m_dir, "wq5", 7, r.limitMb);
        ASSERT_TRUE(write(writer, record));
        EXPECT_EQ(names(), expected);
        EXPECT_EQ(sizeOf(r.target), r.before + static_cast<int64_t>(record.size()));
        EXPECT_EQ(bytesAt(r.target, r.before), record);
    }
}

TEST_F(Beyond32, RecordPassingA3000MbLimitIsTheLastOfItsFile)
{
    const int64_t limit = 3000 * MiB;
    makeFile("20400229.wq5", limit - 4);
    DataWriter writer(m_dir, "wq5", 7, 3000);
    ASSERT_TRUE(write(writer, "abcdefgh\n"));  // ends 5 bytes over the limit
    ASSERT_TRUE(write(writer, "next\n"));
    EXPECT_EQ(sizeOf("20400229.wq5"), limit + 5);
    EXPECT_EQ(bytesAt("20400229.wq5", limit - 4), "abcdefgh\n");
    EXPECT_EQ(bytesAt("20400229.1.wq5", 0), "next\n");
}

TEST_F(Beyond32, DaysPast2038NameTheirFiles)
{
    const struct {
        wq5_time_t now, periodStart;
        const char* file;
    } rows[] = {
        {2147483647, JAN19_2038, "20380119.wq5"},  // the largest signed 32-bit time
        {2147483648, JAN19_2038, "20380119.wq5"},
        {FEB29_2040 + DAY - 1, FEB29_2040, "20400229.wq5"},
        {FEB29_2040 + DAY, FEB29_2040 + DAY, "20400301.wq5"},
        {4294967296, FEB07_2106, "21060207.wq5"},  // past the unsigned 32-bit times
    };
    for (const auto& r : rows) {
        g_now = r.now;
        reset();
        EXPECT_EQ(calcPeriodStart(DAY), r.periodStart) << "now " << r.now;
        DataWriter writer(m_dir, "wq5", 7, 0);
        ASSERT_TRUE(write(writer, "x\n")) << "now " << r.now;
        EXPECT_EQ(names(), std::set<std::string>{r.file}) << "now " << r.now;
    }
}

TEST_F(Beyond32, RetentionThresholdAfter2038)
{
    // From 2040-02-29: 7 days back is 2040-02-22; 771 days back is day
    // 24855, 2038-01-19; 772 days back is 2038-01-18.
    const struct {
        long keepDays;
        const char* threshold;
        std::set<std::string> survivors;
    } rows[] = {
        {7, "20400222", {"20400222.wq5", "20400229.wq5"}},
        {771, "20380119", {"20380119.wq5", "20400221.wq5", "20400222.wq5", "20400229.wq5"}},
        {772, "20380118", {"20380118.wq5", "20380119.wq5", "20400221.wq5", "20400222.wq5", "20400229.wq5"}},
    };
    for (const auto& r : rows) {
        reset();
        for (const char* name : {"20380118.wq5", "20380119.wq5", "20400221.wq5", "20400222.wq5"})
            makeFile(name, 1);
        DataWriter writer(m_dir, "wq5", r.keepDays, 0);
        TraceCapture capture(TRC_DETAIL);
        ASSERT_TRUE(write(writer, "x\n"));
        EXPECT_EQ(capture.count(std::string("Threshold <") + r.threshold + ">"), 1) << r.keepDays << " days";
        EXPECT_EQ(names(), r.survivors) << r.keepDays << " days";
    }
}

}  // namespace
