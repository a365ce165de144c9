// libmoq: the trace and environment services behind platform/moq.h, and the
// run-time control of libmoq/moq_control.h.
//
// A trace line is built whole in memory and handed on at once: to the sink
// when a test has set one, else to the trace file with a single write(2) on
// a descriptor opened with O_APPEND, so that lines of concurrent threads and
// processes never interleave.
#include "platform/moq.h"

#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <mutex>
#include <string>

#include "libmoq/moq_control.h"
#include "libmoq/moq_settings.h"

namespace {

// The generation every synchronised block watches. It starts at 1 and never
// becomes 0, the value of a block that has never been synchronised.
unsigned int g_generation = 1;

// Tracing must not disturb the caller's errno: callers often trace a
// failure and then act on the errno that caused it.
class ErrnoKeeper {
public:
    ErrnoKeeper() : m_saved(errno) {}
    ~ErrnoKeeper() { errno = m_saved; }
    ErrnoKeeper(const ErrnoKeeper&) = delete;
    ErrnoKeeper& operator=(const ErrnoKeeper&) = delete;

private:
    int m_saved;
};

void writeAll(int fd, const char* data, size_t length)
{
    // One write() carries the whole line; the loop only finishes a write
    // that a signal or a full pipe cut short.
    while (length > 0) {
        const ssize_t written = ::write(fd, data, length);
        if (written < 0) {
            if (errno == EINTR)
                continue;
            return;  // nowhere left to report it
        }
        data += written;
        length -= static_cast<size_t>(written);
    }
}

// Appends `length` bytes, printable ASCII as they are and everything else
// escaped, so that a line stays one line of text whatever it carries.
void appendEscaped(std::string& out, const char* text, size_t length)
{
    static const char HEX[] = "0123456789abcdef";
    for (size_t i = 0; i < length; ++i) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        switch (c) {
        case '\\': out += "\\\\"; break;
        case '\n': out += "\\n"; break;
        case '\r': out += "\\r"; break;
        case '\t': out += "\\t"; break;
        default:
            if (c >= 0x20 && c < 0x7f) {
                out += static_cast<char>(c);
            } else {
                const char escape[4] = {'\\', 'x', HEX[c >> 4], HEX[c & 0x0f]};
                out.append(escape, sizeof(escape));
            }
        }
    }
}

void appendEscaped(std::string& out, const char* text)
{
    appendEscaped(out, text, std::strlen(text));
}

// Settings: MOQ_TRACE and MOQ_TRACE_FILE, read once on first use.

bool sameWord(const char* text, size_t length, const char* word)
{
    if (std::strlen(word) != length)
        return false;
    for (size_t i = 0; i < length; ++i)
        if (std::tolower(static_cast<unsigned char>(text[i])) != word[i])
            return false;
    return true;
}

bool parseNumber(const char* text, int* mask)
{
    const bool hex = text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
    const char* digits = hex ? text + 2 : text;
    const unsigned base = hex ? 16 : 10;
    if (*digits == '\0')
        return false;
    unsigned long long value = 0;
    for (const char* p = digits; *p != '\0'; ++p) {
        const unsigned char c = static_cast<unsigned char>(*p);
        unsigned digit;
        if (std::isdigit(c))
            digit = c - '0';
        else if (hex && std::isxdigit(c))
            digit = static_cast<unsigned>(std::tolower(c) - 'a' + 10);
        else
            return false;
        value = value * base + digit;
        if (value > static_cast<unsigned long long>(INT_MAX))
            return false;
    }
    *mask = static_cast<int>(value);
    return true;
}

bool parseList(const char* text, int* mask)
{
    static const struct {
        const char* name;
        int bits;
    } NAMES[] = {
        {"error", TRC_ERROR}, {"flow", TRC_FLOW}, {"info", TRC_INFO},
        {"detail", TRC_DETAIL}, {"all", moq::ALL_MASK}, {"none", 0},
    };
    int result = 0;
    const char* item = text;
    for (;;) {
        const char* end = std::strchr(item, ',');
        if (end == nullptr)
            end = item + std::strlen(item);
        const char* first = item;
        const char* last = end;
        while (first < last && std::isspace(static_cast<unsigned char>(*first)))
            ++first;
        while (last > first && std::isspace(static_cast<unsigned char>(last[-1])))
            --last;
        bool known = false;
        for (const auto& entry : NAMES) {
            if (sameWord(first, static_cast<size_t>(last - first), entry.name)) {
                result |= entry.bits;
                known = true;
                break;
            }
        }
        if (!known)
            return false;
        if (*end == '\0')
            break;
        item = end + 1;
    }
    *mask = result;
    return true;
}

}  // namespace

namespace moq {

bool parseMask(const char* text, int* mask)
{
    if (text == nullptr || mask == nullptr || *text == '\0')
        return false;
    if (std::isdigit(static_cast<unsigned char>(text[0])))
        return parseNumber(text, mask);
    return parseList(text, mask);
}

}  // namespace moq

namespace {

void reportSetting(int fd, const char* what, const char* value, const char* problem)
{
    std::string text = "moq: ";
    text += what;
    text += " <";
    appendEscaped(text, value);
    text += "> ";
    text += problem;
    text += '\n';
    writeAll(fd, text.data(), text.size());
}

struct Settings {
    int mask;  // initial class mask
    int fd;    // where trace lines go: the opened trace file or 2
};

// Builds the settings from the values of MOQ_TRACE and MOQ_TRACE_FILE (null
// or empty: unset). A value that cannot be used is reported with one line
// on `reportFd` and its default taken instead. An opened trace file stays
// open for the life of the process.
Settings loadSettings(const char* traceValue, const char* fileValue, int reportFd)
{
    Settings settings{moq::DEFAULT_MASK, STDERR_FILENO};
    if (traceValue != nullptr && *traceValue != '\0' && !moq::parseMask(traceValue, &settings.mask)) {
        reportSetting(reportFd, "MOQ_TRACE", traceValue,
                      "is neither a number nor a list of error, flow, info, detail, all, none;"
                      " using error,flow,info");
    }
    if (fileValue != nullptr && *fileValue != '\0') {
        const int fd = ::open(fileValue, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (fd >= 0) {
            settings.fd = fd;
        } else {
            const int error = errno;
            const std::string problem = "cannot be opened (errno " + std::to_string(error) + ": " +
                                        std::strerror(error) + "); tracing to standard error";
            reportSetting(reportFd, "MOQ_TRACE_FILE", fileValue, problem.c_str());
        }
    }
    return settings;
}

// Trace lines: built whole, then handed to the sink or the trace file.

struct Library {
    explicit Library(const Settings& settings) : mask(settings.mask), fd(settings.fd) {}

    std::atomic<int> mask;
    const int fd;

    // Serialises the refreshing of block caches, see TRC1_Sync.
    std::mutex syncLock;

    // Guards the sink; held while the sink runs, so that once MOQ_SetSink
    // returns the previous sink is neither running nor called again.
    std::mutex sinkLock;
    std::atomic<bool> sinkSet{false};
    MOQ_Sink sink = nullptr;
    void* sinkContext = nullptr;
};

// Reads the settings on first use, on whichever thread gets there first.
// Never destroyed: other libraries may still trace from their exit-time
// destructors.
Library& library()
{
    static Library* const lib = new Library(
        loadSettings(std::getenv("MOQ_TRACE"), std::getenv("MOQ_TRACE_FILE"), STDERR_FILENO));
    return *lib;
}

const char* unitName(const TRC1_EPB* block)
{
    return (block != nullptr && block->unit != nullptr && block->unit->unitName != nullptr)
               ? block->unit->unitName
               : "?";
}

const char* funcName(const TRC1_EPB* block)
{
    return (block != nullptr && block->funcName != nullptr) ? block->funcName : "?";
}

// "2024-03-05T14:07:09.123456Z [4711] mcfg:57 Config::Config: "
void appendPrefix(std::string& out, const TRC1_EPB* block, int line)
{
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    struct tm utc;
    gmtime_r(&now.tv_sec, &utc);
    char stamp[128];
    const int n = std::snprintf(stamp, sizeof(stamp), "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ [%ld] ",
                                utc.tm_year + 1900, utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min,
                                utc.tm_sec, static_cast<long>(now.tv_nsec / 1000),
                                static_cast<long>(::syscall(SYS_gettid)));
    if (n > 0)
        out.append(stamp, std::min(static_cast<size_t>(n), sizeof(stamp) - 1));
    appendEscaped(out, unitName(block));
    out += ':';
    out += std::to_string(line);
    out += ' ';
    appendEscaped(out, funcName(block));
    out += ": ";
}

void emit(std::string& line)
{
    line += '\n';
    Library& lib = library();
    if (lib.sinkSet.load(std::memory_order_acquire)) {
        std::lock_guard<std::mutex> guard(lib.sinkLock);
        if (lib.sink != nullptr) {
            lib.sink(lib.sinkContext, line.data(), line.size());
            return;
        }
    }
    writeAll(lib.fd, line.data(), line.size());
}

// Formats the message into `out`: whole up to MAX_MESSAGE bytes, beyond
// that cut and followed by a marker naming the full length.
void appendMessage(std::string& out, const char* format, va_list args)
{
    if (format == nullptr) {
        out += "(null format)";
        return;
    }
    // Most messages fit here; a longer one is formatted a second time into
    // a buffer of the length the first pass reported.
    char small[1024];
    va_list first;
    va_copy(first, args);
    const int length = std::vsnprintf(small, sizeof(small), format, first);
    va_end(first);
    if (length < 0) {
        out += "(message cannot be formatted: <";
        appendEscaped(out, format);
        out += ">)";
        return;
    }
    const size_t full = static_cast<size_t>(length);
    if (full < sizeof(small)) {
        appendEscaped(out, small, full);
        return;
    }
    const size_t kept = std::min(full, moq::MAX_MESSAGE);
    std::unique_ptr<char[]> big(new char[kept + 1]);
    std::vsnprintf(big.get(), kept + 1, format, args);
    appendEscaped(out, big.get(), kept);
    if (kept < full)
        out += " [cut at " + std::to_string(kept) + " of " + std::to_string(full) + " bytes]";
}

void printfLine(const TRC1_EPB* block, int line, const char* format, va_list args) noexcept
{
    try {
        std::string text;
        appendPrefix(text, block, line);
        appendMessage(text, format, args);
        emit(text);
    } catch (...) {
    }
}

}  // namespace

// The C entry points let no exception out: a trace that cannot be built
// (out of memory) is dropped, a mask that cannot be read is the default.

extern "C" MOQ_EXPORT int TRC1_Sync(TRC1_EPB* block)
{
    ErrnoKeeper keepErrno;
    try {
        Library& lib = library();
        if (block == nullptr)
            return lib.mask.load(std::memory_order_relaxed);
        // Two threads refreshing the same block must not leave an older
        // mask paired with a newer generation, or the block would keep the
        // old mask until the next change. Under the lock every refresh reads
        // the generation first and the mask after it, so the pair stored
        // last is never older than its generation says; a mask change in
        // between only makes the block refresh once more.
        std::lock_guard<std::mutex> guard(lib.syncLock);
        const unsigned int generation = __atomic_load_n(&g_generation, __ATOMIC_ACQUIRE);
        const int mask = lib.mask.load(std::memory_order_relaxed);
        __atomic_store_n(&block->generation, &g_generation, __ATOMIC_RELEASE);
        __atomic_store_n(&block->cachedMask, mask, __ATOMIC_RELAXED);
        __atomic_store_n(&block->cachedGeneration, generation, __ATOMIC_RELEASE);
        return mask;
    } catch (...) {
        return moq::DEFAULT_MASK;
    }
}

extern "C" MOQ_EXPORT void TRC1_Event(TRC1_EPB* block, int line, int kind, ...)
{
    ErrnoKeeper keepErrno;
    try {
        std::string text;
        appendPrefix(text, block, line);
        switch (kind) {
        case TRC1_ENTRY:
            text += "> ";
            appendEscaped(text, funcName(block));
            break;
        case TRC1_EXIT_VALUE: {
            va_list args;
            va_start(args, kind);
            const int value = va_arg(args, int);
            va_end(args);
            text += "< ";
            appendEscaped(text, funcName(block));
            text += " rc=" + std::to_string(value);
            break;
        }
        case TRC1_EXIT:
            text += "< ";
            appendEscaped(text, funcName(block));
            break;
        default:
            // An unknown kind carries no value we could safely read.
            text += "? ";
            appendEscaped(text, funcName(block));
            text += " kind=" + std::to_string(kind);
            break;
        }
        emit(text);
    } catch (...) {
    }
}

extern "C" MOQ_EXPORT void TRC1_Printf(TRC1_EPB* block, int line, const char* format, ...)
{
    ErrnoKeeper keepErrno;
    va_list args;
    va_start(args, format);
    printfLine(block, line, format, args);
    va_end(args);
}

extern "C" MOQ_EXPORT const char* QEN1_GetEnv(const char* name, const char* dflt)
{
    const char* value = name != nullptr ? std::getenv(name) : nullptr;
    return (value != nullptr && *value != '\0') ? value : dflt;
}

extern "C" MOQ_EXPORT void MOQ_SetMask(int mask)
{
    try {
        library().mask.store(mask, std::memory_order_relaxed);
        // The release publishes the mask to every TRC1_Sync that reads the
        // new generation. Zero is skipped: it means "never synchronised".
        unsigned int current = __atomic_load_n(&g_generation, __ATOMIC_RELAXED);
        unsigned int next;
        do {
            next = current + 1 == 0 ? 1 : current + 1;
        } while (!__atomic_compare_exchange_n(&g_generation, &current, next, true, __ATOMIC_RELEASE,
                                              __ATOMIC_RELAXED));
    } catch (...) {
    }
}

extern "C" MOQ_EXPORT int MOQ_GetMask(void)
{
    try {
        return library().mask.load(std::memory_order_relaxed);
    } catch (...) {
        return moq::DEFAULT_MASK;
    }
}

extern "C" MOQ_EXPORT void MOQ_SetSink(MOQ_Sink sink, void* context)
{
    try {
        Library& lib = library();
        std::lock_guard<std::mutex> guard(lib.sinkLock);
        lib.sink = sink;
        lib.sinkContext = context;
        lib.sinkSet.store(sink != nullptr, std::memory_order_release);
    } catch (...) {
    }
}
