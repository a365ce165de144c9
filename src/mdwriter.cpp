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
      m_statusCheck(0)
{
}

DataWriter::~DataWriter()
{
    if (m_stream != nullptr)
        fclose(m_stream);
}

void DataWriter::setMaxSizeBytes(int64_t bytes)
{
    m_maxSizeBytes = bytes > 0 ? bytes : 0;
}

bool DataWriter::openFileStale(wq5_time_t now)
{
    const bool limited = m_maxSizeBytes > 0;
    // Without a limit the only question is whether the file was removed;
    // asking once a second keeps the record path at one clock read.
    if (!limited && now == m_statusCheck)
        return false;
    m_statusCheck = now;

    struct stat64 status;
    if (fstat64(fileno(m_stream), &status) != 0)
        return false;
    // Records written to a removed file would vanish with it.
    if (status.st_nlink == 0)
        return true;
    return limited && status.st_size > m_maxSizeBytes;
}

int DataWriter::reopen(wq5_time_t periodStart, wq5_time_t now)
{
    const int mask = trc1Mask(&s_checkAndOpenBlock);

    if (m_stream != nullptr) {
        fclose(m_stream);
        m_stream = nullptr;
    }
    std::string name;
    getLogfileName(periodStart, name);
    deleteOldFiles(periodStart);

    m_stream = fopen64(name.c_str(), "a");
    if (m_stream != nullptr) {
        if (mask & TRC_INFO)
            TRC1_Printf(&s_checkAndOpenBlock, __LINE__, "Data file <%s> opened successfully.", name.c_str());
        m_openPeriod = periodStart;
        m_openErrors = 0;
        m_statusCheck = now;
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
    // One clock read serves both the day and the once-a-second status check.
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
