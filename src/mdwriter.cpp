#include "mdwriter.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include <dirent.h>
#include <glob.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/moq.h"

// Log files may grow beyond 2 GiB on every build: sizes come from the *64
// status calls and streams are opened with fopen64, whatever off_t is.

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mdwriter");

// checkAndOpen hands the reopen to a helper; both trace under its name.
static TRC1_EPB s_checkAndOpenBlock = TRC1_BLOCK_INIT(s_unit, "DataWriter::checkAndOpen");

static const wq5_time_t SECONDS_PER_DAY = 86400;
static const int64_t BYTES_PER_MB = 1048576;

// ---------------------------------------------------------------------------
// Clock

static std::atomic<WriterClock> s_clock{nullptr};

void setWriterClock(WriterClock clock)
{
    s_clock.store(clock, std::memory_order_release);
}

static wq5_time_t currentTime()
{
    const WriterClock clock = s_clock.load(std::memory_order_acquire);
    return clock ? clock() : static_cast<wq5_time_t>(time(nullptr));
}

// ---------------------------------------------------------------------------
// Output calls

static std::atomic<WriterIo::WriteCall> s_write{nullptr};
static std::atomic<WriterIo::FlushCall> s_flush{nullptr};
static std::atomic<WriterIo::TruncateCall> s_truncate{nullptr};

void setWriterIo(const WriterIo& io)
{
    s_write.store(io.write, std::memory_order_release);
    s_flush.store(io.flush, std::memory_order_release);
    s_truncate.store(io.truncate, std::memory_order_release);
}

static size_t ioWrite(const char* data, size_t length, FILE* stream)
{
    const WriterIo::WriteCall call = s_write.load(std::memory_order_acquire);
    return call ? call(data, 1, length, stream) : fwrite(data, 1, length, stream);
}

static int ioFlush(FILE* stream)
{
    const WriterIo::FlushCall call = s_flush.load(std::memory_order_acquire);
    return call ? call(stream) : fflush(stream);
}

static int ioTruncate(int fd, int64_t length)
{
    const WriterIo::TruncateCall call = s_truncate.load(std::memory_order_acquire);
    return call ? call(fd, length) : ftruncate64(fd, static_cast<off64_t>(length));
}

static wq5_time_t periodStartAt(wq5_time_t now, wq5_time_t period)
{
    if (period <= 0)
        return now;
    const wq5_time_t rest = now % period;
    if (rest != 0)
        now -= rest;
    return now;
}

wq5_time_t calcPeriodStart(wq5_time_t period)
{
    return periodStartAt(currentTime(), period);
}

// ---------------------------------------------------------------------------
// Naming

void time2str(wq5_time_t t, std::string& out)
{
    // A 32-bit time_t cannot hold every 64-bit time; such a time is one that
    // "cannot be broken down", not one to be truncated into another date.
    const time_t asTimeT = static_cast<time_t>(t);
    if (static_cast<wq5_time_t>(asTimeT) != t)
        return;
    struct tm fields;
    if (gmtime_r(&asTimeT, &fields) == nullptr)
        return;
    char buffer[13];
    // A year too long for the buffer makes strftime return 0 with the buffer
    // undefined.
    if (strftime(buffer, sizeof buffer, "%Y%m%d", &fields) == 0)
        return;
    out = buffer;
}

// Decimal digits (leading zeros allowed) to an int; false when the value
// does not fit, so that an over-long number never counts as some other one.
static bool digitsToInt(const char* digits, int* value)
{
    int result = 0;
    for (const char* p = digits; *p != '\0'; ++p) {
        const int digit = *p - '0';
        if (result > (INT_MAX - digit) / 10)
            return false;
        result = result * 10 + digit;
    }
    *value = result;
    return true;
}

static bool isDecimalDigit(char c)
{
    return c >= '0' && c <= '9';
}

int parseSeq(char* path, const char* suffix)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "parseSeq");
    const int mask = trc1Mask(&blk);

    if (mask & TRC_INFO)
        TRC1_Printf(&blk, __LINE__, "Parsing: %s", path);

    char* slash = strrchr(path, '/');
    char* firstDot = strchr(slash ? slash : path, '.');
    if (firstDot == nullptr)
        return 0;

    char* digits = firstDot + 1;
    if (mask & TRC_INFO)
        TRC1_Printf(&blk, __LINE__, "Found start: %s", digits);

    char* end = digits;
    for (; *end != '\0' && *end != '.'; ++end)
        if (!isDecimalDigit(*end))
            return 0;
    if (*end == '\0' || end == digits || strcmp(end + 1, suffix) != 0)
        return 0;

    *end = '\0';
    if (mask & TRC_INFO) {
        TRC1_Printf(&blk, __LINE__, "Boundaries %lx<%c> %lx<%c>",
                    static_cast<unsigned long>(reinterpret_cast<uintptr_t>(digits)), *digits,
                    static_cast<unsigned long>(reinterpret_cast<uintptr_t>(end)), *end);
        TRC1_Printf(&blk, __LINE__, "End trimmed: %s", digits);
    }
    int seq = 0;
    const bool fits = digitsToInt(digits, &seq);
    *end = '.';
    if (!fits)
        return 0;

    if (mask & TRC_INFO)
        TRC1_Printf(&blk, __LINE__, "Sequence: %d", seq);
    return seq;
}

std::string DataWriter::buildName(const std::string& date, int seq) const
{
    std::string name = m_logDir + date + ".";
    if (seq > 0)
        name += std::to_string(seq) + ".";
    return name + m_suffix;
}

bool DataWriter::overLimit(const std::string& name) const
{
    struct stat64 status;
    return m_maxSizeBytes > 0 && stat64(name.c_str(), &status) == 0 && status.st_size > m_maxSizeBytes;
}

void DataWriter::getLogfileName(wq5_time_t periodStart, std::string& name)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataWriter::getLogfileName");
    const int mask = trc1Mask(&blk);

    std::string date;
    time2str(periodStart, date);

    // The directory goes in unchanged: wildcard characters in it act as
    // wildcards, as a shell user of the same setting would expect.
    const std::string pattern = m_logDir + date + "*." + m_suffix;
    int latest = 0;
    glob_t matches;
    memset(&matches, 0, sizeof matches);
    if (glob(pattern.c_str(), 0, nullptr, &matches) == 0) {
        if (mask & TRC_INFO)
            TRC1_Printf(&blk, __LINE__, "Found %d logs for this period", static_cast<int>(matches.gl_pathc));
        for (size_t i = 0; i < matches.gl_pathc; ++i) {
            const int seq = parseSeq(matches.gl_pathv[i], m_suffix.c_str());
            if (seq > latest)
                latest = seq;
        }
    }
    globfree(&matches);

    if (mask & TRC_INFO)
        TRC1_Printf(&blk, __LINE__, "Latest sequence number: %d", latest);

    name = buildName(date, latest);
    // There is no number after INT_MAX: that file then grows past the limit.
    if (latest < INT_MAX && overLimit(name))
        name = buildName(date, latest + 1);

    if (mask & TRC_INFO)
        TRC1_Printf(&blk, __LINE__, "Logfile: %s", name.c_str());
}

// ---------------------------------------------------------------------------
// Retention

// `periodStart` minus `keepDays` days; false when that is out of range, in
// which case no file can be older than it.
static bool retentionThreshold(wq5_time_t periodStart, long keepDays, wq5_time_t* threshold)
{
    wq5_time_t span;
    if (__builtin_mul_overflow(static_cast<wq5_time_t>(keepDays), SECONDS_PER_DAY, &span))
        return false;
    return !__builtin_sub_overflow(periodStart, span, threshold);
}

// A log file (last extension exactly `suffix`) whose name sorts before the
// threshold date. Names that do not start with a date are judged the same
// way, as plain byte strings.
static bool isExpiredLog(const char* name, const std::string& suffix, const std::string& threshold)
{
    const char* dot = strrchr(name, '.');
    if (dot == nullptr || suffix != dot + 1)
        return false;
    return threshold.compare(name) > 0;
}

void DataWriter::deleteOldFiles(wq5_time_t periodStart)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataWriter::deleteOldFiles");
    const int mask = trc1Mask(&blk);

    const long nameMax = pathconf(m_logDir.c_str(), _PC_NAME_MAX);
    if (m_keepDays <= 0 || nameMax <= 0)
        return;

    wq5_time_t thresholdTime;
    if (!retentionThreshold(periodStart, m_keepDays, &thresholdTime))
        return;

    // One buffer holds the path of every entry in turn: the directory, the
    // longest name the file system allows and its terminator.
    const size_t dirLength = m_logDir.size();
    char* path = static_cast<char*>(malloc(dirLength + static_cast<size_t>(nameMax) + 1));
    if (path == nullptr) {
        if (mask & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "malloc failed.  errno <%d>", errno);
        return;
    }
    memcpy(path, m_logDir.data(), dirLength);

    std::string threshold;
    time2str(thresholdTime, threshold);
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "Threshold <%s>", threshold.c_str());

    DIR* dir = opendir(m_logDir.c_str());
    if (dir == nullptr) {
        free(path);
        return;
    }
    // readdir needs no entry buffer of ours, so no entry name can overrun
    // one; the stream is ours alone, under the writer's mutex.
    while (const struct dirent64* entry = readdir64(dir)) {
        const char* name = entry->d_name;
        const size_t nameLength = strlen(name);
        if (nameLength > static_cast<size_t>(nameMax))
            continue;  // cannot happen unless pathconf understates the limit
        memcpy(path + dirLength, name, nameLength + 1);

        struct stat64 status;
        if (stat64(path, &status) != 0 || !S_ISREG(status.st_mode))
            continue;
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "Checking <%s>", name);
        if (isExpiredLog(name, m_suffix, threshold)) {
            if (mask & TRC_INFO)
                TRC1_Printf(&blk, __LINE__, "Removing <%s>", path);
            unlink(path);
        }
    }
    closedir(dir);
    free(path);
}

// ---------------------------------------------------------------------------
// Writer

static int64_t megabytesToBytes(long megabytes)
{
    if (megabytes <= 0)
        return 0;
    int64_t bytes;
    if (__builtin_mul_overflow(static_cast<int64_t>(megabytes), BYTES_PER_MB, &bytes))
        return INT64_MAX;
    return bytes;
}

static std::string withTrailingSlash(const std::string& dir)
{
    if (dir.empty())
        return "./";
    if (dir.back() == '/')
        return dir;
    return dir + "/";
}

DataWriter::DataWriter(const std::string& logDir, const std::string& suffix, long keepDays, long maxSizeMb)
    : m_stream(nullptr),
      m_openPeriod(0),
      m_logDir(withTrailingSlash(logDir)),
      m_suffix(suffix),
      m_keepDays(keepDays),
      m_maxSizeMb(maxSizeMb),
      m_openErrors(0),
      m_maxSizeBytes(megabytesToBytes(maxSizeMb)),
      m_fileName(),
      m_fileSize(-1),
      m_statusCheck(0),
      m_cutTo(-1),
      m_lostRecords(0)
{
}

DataWriter::~DataWriter()
{
    closeStream();
}

void DataWriter::setMaxSizeBytes(int64_t bytes)
{
    m_maxSizeBytes = bytes > 0 ? bytes : 0;
}

bool DataWriter::openFileStale(wq5_time_t now)
{
    // With a limit the size is asked for every record. Without one, the
    // status is asked at most once a second, to notice a removed file, and
    // the size is otherwise kept up to date by writeRecord: a status query
    // per record would cost as much as the write itself.
    const bool limited = m_maxSizeBytes > 0;
    if (!limited && now == m_statusCheck)
        return false;
    m_statusCheck = now;
    struct stat64 status;
    if (fstat64(fileno(m_stream), &status) != 0) {
        m_fileSize = -1;
        return false;
    }
    m_fileSize = status.st_size;
    if (status.st_nlink == 0)
        return true;
    return limited && status.st_size > m_maxSizeBytes;
}

void DataWriter::closeStream()
{
    if (m_stream == nullptr)
        return;
    cutBack();
    fclose(m_stream);
    m_stream = nullptr;
    m_cutTo = -1;
}

int DataWriter::reopen(wq5_time_t periodStart, wq5_time_t now)
{
    const int mask = trc1Mask(&s_checkAndOpenBlock);

    closeStream();
    std::string name;
    getLogfileName(periodStart, name);
    deleteOldFiles(periodStart);

    m_stream = fopen64(name.c_str(), "a");
    if (m_stream != nullptr) {
        // Unbuffered: the one fwrite of a record is one write to the file,
        // and a failed record can never stay behind in a buffer, to reach
        // the file later in pieces behind the records after it (a failed
        // fflush may keep its data, and standard C has no call that
        // discards it). The flush after each record then has nothing to do.
        setvbuf(m_stream, nullptr, _IONBF, 0);
        if (mask & TRC_INFO)
            TRC1_Printf(&s_checkAndOpenBlock, __LINE__, "Data file <%s> opened successfully.", name.c_str());
        m_fileName = name;
        m_fileSize = -1;  // asked for by the first record
        m_statusCheck = now;
        m_openPeriod = periodStart;
        m_openErrors = 0;
        return 0;
    }
    if (m_openErrors == 0 && (mask & TRC_ERROR))
        TRC1_Printf(&s_checkAndOpenBlock, __LINE__, "Error: Data file <%s> cannot be opened", name.c_str());
    if (m_openErrors < UINT32_MAX)
        ++m_openErrors;
    return -1;
}

int DataWriter::checkAndOpen()
{
    // One clock reading per record serves the day and the status checks.
    const wq5_time_t now = currentTime();
    const wq5_time_t periodStart = periodStartAt(now, SECONDS_PER_DAY);

    if (periodStart <= m_openPeriod && m_stream != nullptr && openFileStale(now))
        m_openPeriod = 0;
    // Without a stream every record retries, also when the clock has been
    // set back behind the day of the last open file.
    if (periodStart > m_openPeriod || m_stream == nullptr)
        return reopen(periodStart, now);
    return 0;
}

bool DataWriter::writeRecord(const char* data, size_t length)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataWriter::writeRecord");
    const int mask = trc1Mask(&blk);

    if (m_stream == nullptr)
        return recordLost(errno);
    // A record never goes behind the remains of a failed one, nor where a
    // failure could not be undone.
    if (!cutBack())
        return recordLost(errno);
    // Where a failed record is cut back to. The collector is the file's
    // only writer, so the size it keeps is the file's end.
    int64_t start = m_fileSize;
    if (start < 0) {
        struct stat64 status;
        if (fstat64(fileno(m_stream), &status) != 0)
            return recordLost(errno);
        start = status.st_size;
    }
    m_fileSize = -1;

    errno = 0;
    if (ioWrite(data, length, m_stream) == length && ioFlush(m_stream) == 0) {
        if (m_lostRecords > 0) {
            if (mask & TRC_ERROR)
                TRC1_Printf(&blk, __LINE__, "Log file writing resumed; %lu records lost.", m_lostRecords);
            m_lostRecords = 0;
        }
        m_fileSize = start + static_cast<int64_t>(length);
        return true;
    }
    const int error = errno;
    // Take off whatever part of the record reached the file, so that the
    // file ends on a whole record and the next one starts a line of its
    // own. The stream holds nothing of it: it has no buffer (see reopen).
    clearerr(m_stream);
    m_cutTo = start;
    if (cutBack())
        m_fileSize = start;
    else if (mask & TRC_ERROR)
        TRC1_Printf(&blk, __LINE__, "Error: Data file <%s> cannot be cut back to <%lld> bytes, errno <%d>",
                    m_fileName.c_str(), static_cast<long long>(start), errno);
    return recordLost(error);
}

bool DataWriter::cutBack()
{
    if (m_cutTo < 0)
        return true;
    if (ioTruncate(fileno(m_stream), m_cutTo) != 0)
        return false;
    m_cutTo = -1;
    return true;
}

bool DataWriter::recordLost(int error)
{
    if (m_lostRecords < ULONG_MAX)
        ++m_lostRecords;
    errno = error;
    return false;
}

void DataWriter::release()
{
    if (m_stream != nullptr)
        fflush(m_stream);
}

DataWriterLock::DataWriterLock(DataWriter& writer) : m_lock(writer.m_mutex, true), m_writer(&writer)
{
    m_writer->checkAndOpen();
}

DataWriterLock::~DataWriterLock()
{
    m_writer->release();
}

FILE* DataWriterLock::getStream()
{
    return m_writer->m_stream;
}

bool DataWriterLock::writeRecord(const char* data, size_t length)
{
    return m_writer->writeRecord(data, length);
}
