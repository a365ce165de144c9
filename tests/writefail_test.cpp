// A record reaches the log whole or not at all: faults injected into the
// writer's write, flush and cut calls (errors, short writes of every length,
// failing flushes, failing cuts) leave the file ending on whole records;
// each dropped record is reported, and the next record written tells how
// many were lost since writing last succeeded.
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

#include <sys/stat.h>
#include <unistd.h>

#include "src/mdwriter.h"
#include "support/handler_fixture.h"
#include "support/table_builder.h"
#include "support/trace_capture.h"

namespace {

using namespace wq5test;

// What the injected calls do to one record.
struct Fault {
    size_t through;  // bytes of the record the write lets reach the file
    int writeError;  // errno when the write stops short
    int flushError;  // non-zero: the flush fails with it
    int cutErrors;   // cuts from now on that fail with EIO
};
const Fault OK = {SIZE_MAX, 0, 0, 0};
const Fault NO_SPACE = {0, ENOSPC, 0, 0};

Fault g_fault = OK;
int g_cutErrors = 0;

size_t faultyWrite(const void* data, size_t size, size_t count, FILE* stream)
{
    const size_t through = std::min(g_fault.through, size * count);
    const size_t written = fwrite(data, 1, through, stream);
    if (written < size * count)
        errno = g_fault.writeError;
    return written / size;
}

int faultyFlush(FILE* stream)
{
    if (g_fault.flushError == 0)
        return fflush(stream);
    errno = g_fault.flushError;
    return EOF;
}

int faultyTruncate(int fd, int64_t length)
{
    if (g_cutErrors == 0)
        return ftruncate64(fd, length);
    --g_cutErrors;
    errno = EIO;
    return -1;
}

// Video record number `n`: entry with mediaInt0 = n, the handler's n-th GUID.
std::string record(int n)
{
    char guid[40];
    snprintf(guid, sizeof guid, "1a2b4d0000001234%08xwq5coll", static_cast<unsigned>(n));
    return std::string("<video>v121^92^0^wq5coll^") + guid + "^0^^^0^^^0^^0^0^0^0^0^0^0^0^0^" +
           "5^N/A^N/A^N/A^N/A^N/A^" + std::to_string(n) + "^0^0</video>\n";
}

std::string lost(unsigned long n)
{
    return "Log file writing resumed; " + std::to_string(n) + " records lost.";
}

std::string failed(int error)
{
    return "Write to log file failed " + std::to_string(error);
}

// Hands record `n` to the handler as a one-entry video table.
void emit(HandlerFixture& fixture, int n, const Fault& fault)
{
    g_fault = fault;
    g_cutErrors += fault.cutErrors;
    TableBuilder table(1);
    setType(table.entry(0), "MSVD");
    table.entry(0).detail.view.media.mediaInt0 = n;
    fixture.handler().processVideo(table.table());
    g_fault = OK;
}

class WriteFaults : public ::testing::Test {
protected:
    void SetUp() override { setWriterIo(WriterIo{&faultyWrite, &faultyFlush, &faultyTruncate}); }
    void TearDown() override
    {
        setWriterIo(WriterIo{nullptr, nullptr, nullptr});
        setWriterClock(nullptr);
        g_cutErrors = 0;
    }
};

struct Case {
    const char* what;
    std::vector<Fault> faults;  // record n gets faults[n]
    std::vector<int> kept;      // records in the file at the end
    std::vector<int> errors;    // "Write to log file failed %d", in order
    bool cutTraced;             // the cut after record 1 failed
};

const Case CASES[] = {
    {"no space, nothing written", {OK, NO_SPACE, OK, OK}, {0, 2, 3}, {ENOSPC}, false},
    {"EIO after 40 bytes", {OK, {40, EIO, 0, 0}, OK, OK}, {0, 2, 3}, {EIO}, false},
    {"written, flush fails EIO", {OK, {SIZE_MAX, 0, EIO, 0}, OK, OK}, {0, 2, 3}, {EIO}, false},
    {"written, flush fails ENOSPC", {OK, {SIZE_MAX, 0, ENOSPC, 0}, OK, OK}, {0, 2, 3}, {ENOSPC}, false},
    {"first record of the file fails", {{9, ENOSPC, 0, 0}, OK, OK, OK}, {1, 2, 3}, {ENOSPC}, false},
    {"two failures in a row", {OK, NO_SPACE, {1, EIO, 0, 0}, OK}, {0, 3}, {ENOSPC, EIO}, false},
    {"cut fails once, retried first", {OK, {40, ENOSPC, 0, 1}, OK, OK}, {0, 2, 3}, {ENOSPC}, true},
    {"cut fails twice, next record dropped", {OK, {40, ENOSPC, 0, 2}, OK, OK}, {0, 3}, {ENOSPC, EIO}, true},
};

TEST_F(WriteFaults, FailedRecordsLeaveNothingBehindAndAreCounted)
{
    for (const Case& c : CASES) {
        HandlerFixture fixture;
        TraceCapture trace(TRC_ERROR);
        for (size_t n = 0; n < c.faults.size(); ++n)
            emit(fixture, static_cast<int>(n), c.faults[n]);

        std::string expected;
        for (int n : c.kept)
            expected += record(n);
        EXPECT_EQ(expected, fixture.log()) << c.what;
        for (int error : {ENOSPC, EIO})
            EXPECT_EQ(std::count(c.errors.begin(), c.errors.end(), error), trace.count(failed(error)))
                << c.what << ": errno " << error;
        EXPECT_EQ(1, trace.count(lost(c.errors.size()))) << c.what;
        EXPECT_GT(trace.indexOf(lost(c.errors.size())), trace.indexOf(failed(c.errors.back()))) << c.what;
        const std::string cut = "> cannot be cut back to <" + std::to_string(record(0).size()) + "> bytes, errno <5>";
        EXPECT_EQ(c.cutTraced ? 1 : 0, trace.count(cut)) << c.what;
    }
}

TEST_F(WriteFaults, ShortWritesOfEveryLengthAreCutOffAtOnce)
{
    HandlerFixture fixture;
    TraceCapture trace(TRC_ERROR);
    emit(fixture, 0, OK);
    std::string expected = record(0);
    int n = 1;
    int failures = 0;
    for (size_t through = 1; through < record(n).size(); ++through, ++failures) {
        emit(fixture, n++, {through, ENOSPC, 0, 0});
        ASSERT_EQ(expected, fixture.log()) << "after a write stopped at byte " << through;
        emit(fixture, n, OK);
        expected += record(n++);
    }
    EXPECT_EQ(expected, fixture.log());
    EXPECT_EQ(failures, trace.count(failed(ENOSPC)));
    EXPECT_EQ(failures, trace.count(lost(1)));
}

TEST_F(WriteFaults, FailedOpensAndWritesAreCountedTogetherUntilARecordIsWritten)
{
    HandlerFixture fixture;
    TraceCapture trace(TRC_ERROR);
    ASSERT_EQ(0, rmdir(fixture.logDir().c_str()));
    emit(fixture, 0, OK);
    emit(fixture, 1, OK);
    ASSERT_EQ(0, mkdir(fixture.logDir().c_str(), 0755));
    emit(fixture, 2, NO_SPACE);
    EXPECT_EQ(0, trace.count(lost(3))) << "nothing written yet";
    emit(fixture, 3, OK);
    emit(fixture, 4, NO_SPACE);
    emit(fixture, 5, OK);
    emit(fixture, 6, OK);

    EXPECT_EQ(record(3) + record(5) + record(6), fixture.log());
    EXPECT_EQ(2, trace.count("Failed to open log file."));
    EXPECT_EQ(2, trace.count(failed(ENOSPC)));
    EXPECT_EQ(1, trace.count(lost(3)));
    EXPECT_EQ(1, trace.count(lost(1))) << "the count starts again from 0";
    EXPECT_EQ(static_cast<int>(trace.lines().size()), trace.indexOf(lost(1)) + 1) << "traced once";
}

wq5_time_t s_now = 1709596800 + 12 * 3600;  // 2024-03-05 12:00:00 UTC
wq5_time_t fixedNow()
{
    return s_now;
}

TEST_F(WriteFaults, RemovedFileIsNoticedWithinASecond)
{
    setWriterClock(&fixedNow);
    HandlerFixture fixture;
    emit(fixture, 0, OK);
    ASSERT_EQ(0, unlink((fixture.logDir() + "/20240305.wq5").c_str()));
    ++s_now;  // the open file's status is asked at most once a second
    emit(fixture, 1, OK);
    EXPECT_EQ(record(1), fixture.log()) << "a record went to the removed file";
}

}  // namespace
