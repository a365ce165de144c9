// The simulated collection library.
//
// Tables travel one way: script lines (or ZUB1SIM_DeliverLine) are parsed
// into finished result areas and queued; each delivery thread takes the
// oldest queued table, finds the filter for its protocol/service and calls
// that filter's callback with no lock held. Delivery runs only while an
// application is registered, and not before the start delay after the
// registration that ended a time without any (and after the application's
// last filter definition), so that an application that
// re-registers gets every table queued behind the one that made it drop out.
//
// Unregistration closes the application under the lock (no callback of it
// starts any more) and then waits until every callback of it still running
// has returned, except those that are themselves waiting inside its
// unregistration: a callback that unregisters its own application must not
// wait for itself, and two that do so at once must not wait for each other.
#include "libzub1api/simulator.h"

#include <cerrno>
#include <climits>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <system_error>

#include <nlohmann/json.hpp>

namespace zub1sim {
namespace {

// Tables the replay thread may queue ahead of delivery; it waits beyond, so
// that a long script is not held in memory all at once.
constexpr size_t REPLAY_QUEUE_LIMIT = 64;

// Tables given back are kept (filled with a pattern) for this many further
// frees before their memory goes back to malloc, so that handing back the
// same table twice is recognised even when malloc would reuse the address
// for the next table at once. AddressSanitizer has a quarantine of its own
// and reports any use of the given-back memory only if it is really freed.
#if defined(__SANITIZE_ADDRESS__)
constexpr size_t QUARANTINE_TABLES = 0;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
constexpr size_t QUARANTINE_TABLES = 0;
#else
constexpr size_t QUARANTINE_TABLES = 64;
#endif
#else
constexpr size_t QUARANTINE_TABLES = 64;
#endif

thread_local bool t_libraryThread = false;    // one of the simulator's own threads
thread_local ZUB_APPL_ID t_callbackAppl = 0;  // application whose callback runs here

long readSetting(const char* name, long min, long max, long fallback)
{
    const char* text = std::getenv(name);
    if (text == nullptr || *text == '\0') return fallback;
    char* end = nullptr;
    errno = 0;
    const long value = std::strtol(text, &end, 10);
    if (errno != 0 || *end != '\0' || value < min || value > max) {
        report("%s=\"%s\" is not a number from %ld to %ld; using %ld", name, text, min, max, fallback);
        return fallback;
    }
    return value;
}

// A rate: a decimal number from 0 to 1000000.
double readRateSetting(const char* name, double fallback)
{
    const char* text = std::getenv(name);
    if (text == nullptr || *text == '\0') return fallback;
    char* end = nullptr;
    errno = 0;
    const double value = std::strtod(text, &end);
    if (errno != 0 || *end != '\0' || !(value >= 0 && value <= 1e6)) {
        report("%s=\"%s\" is not a number from 0 to 1000000; using %g", name, text, fallback);
        return fallback;
    }
    return value;
}

std::string readTextSetting(const char* name)
{
    const char* text = std::getenv(name);
    return text == nullptr ? std::string() : std::string(text);
}

// Why a filter request does not fit this build's layout, or "" when it does.
std::string checkRequest(const ZUB_FILTER_REQUEST& request)
{
    char text[128];
    for (unsigned char byte : request.reserved) {
        if (byte != 0) return "bytes 16 to 67 of the request are not zero";
    }
#if UINTPTR_MAX > 0xffffffffu
    if (request.reserved64 != 0) {
        return "bytes 68 to 71 are not zero; this build takes the callback at offset 72";
    }
#endif
    if (request.level != ZUB_REQ_LEVEL) {
        std::snprintf(text, sizeof text, "level %u, expected %u", request.level, ZUB_REQ_LEVEL);
        return text;
    }
    switch (request.requestType) {
    case ZUB_REQ_DEFINE_FILTER:
        if (request.filterId != 0) return "a define request names a filter id";
        if (request.flags != ZUB_REQ_FLAG_CALLBACK) {
            std::snprintf(text, sizeof text, "flags 0x%x, expected 0x%x", request.flags,
                          ZUB_REQ_FLAG_CALLBACK);
            return text;
        }
        if (request.callback == nullptr) return "a define request without callback";
        return "";
    case ZUB_REQ_REMOVE_FILTER:
        if (request.filterId == 0) return "a remove request without filter id";
        if (request.flags != 0 || request.service != 0 || request.protocol != 0 ||
            request.callback != nullptr) {
            return "a remove request with flags, service, protocol or callback set";
        }
        return "";
    default:
        std::snprintf(text, sizeof text, "unknown request type %u", request.requestType);
        return text;
    }
}

// Replaces `path` as a whole: readers see the old status or the new one.
void writeStatusFile(const std::string& path, const ZUB1SIM_STATS& stats)
{
    const nlohmann::json status = {
        {"tables", stats.tables},
        {"delivered", stats.delivered},
        {"freed", stats.freed},
        {"unmatched", stats.unmatched},
        {"invalid", stats.invalid},
        {"badFrees", stats.badFrees},
        {"registrations", stats.registrations},
        {"refusals", stats.refusals},
        {"unregistrations", stats.unregistrations},
        {"defineRequests", stats.defineRequests},
        {"filtersDefined", stats.filtersDefined},
        {"entries", stats.entries},
        {"skipped", stats.skipped},
    };
    const std::string text = status.dump() + "\n";
    const std::string temp = path + ".tmp";
    FILE* file = std::fopen(temp.c_str(), "w");
    if (file == nullptr) {
        report("%s: cannot create: %s", temp.c_str(), std::strerror(errno));
        return;
    }
    const bool written = std::fwrite(text.data(), 1, text.size(), file) == text.size();
    const int writeErrno = errno;
    if (std::fclose(file) != 0 || !written) {
        report("%s: cannot write: %s", temp.c_str(), std::strerror(written ? errno : writeErrno));
        std::remove(temp.c_str());
        return;
    }
    if (std::rename(temp.c_str(), path.c_str()) != 0) {
        report("%s: cannot rename to %s: %s", temp.c_str(), path.c_str(), std::strerror(errno));
        std::remove(temp.c_str());
    }
}

Simulator g_simulator;

// Registered at the first start of the threads, that is after the
// application's own static objects of that time exist: atexit handlers run
// in reverse order, so the threads are stopped before those objects go,
// and no callback reaches a torn-down application.
void shutdownAtExit() { g_simulator.shutdown(); }

}  // namespace

void report(const char* format, ...)
{
    char text[1024];
    std::va_list args;
    va_start(args, format);
    std::vsnprintf(text, sizeof text, format, args);
    va_end(args);
    std::fprintf(stderr, "zub1api: %s\n", text);
}

Settings Settings::fromEnvironment()
{
    Settings settings;
    settings.replayPath = readTextSetting("ZUB1_REPLAY");
    settings.statusFile = readTextSetting("ZUB1_STATUS_FILE");
    settings.threads = static_cast<int>(readSetting("ZUB1_THREADS", 1, 64, settings.threads));
    settings.startDelayMs =
        static_cast<int>(readSetting("ZUB1_START_DELAY_MS", 0, 3600000, settings.startDelayMs));
    settings.registerFailures = readSetting("ZUB1_REGISTER_FAILURES", 0, LONG_MAX, 0);
    settings.loops = readSetting("ZUB1_LOOPS", 0, LONG_MAX, settings.loops);
    settings.rate = readRateSetting("ZUB1_RATE", settings.rate);
    return settings;
}

Simulator& simulator() { return g_simulator; }

Simulator::~Simulator()
{
    shutdown();
    for (auto& held : m_delivered) std::free(held.first);
    for (void* area : m_quarantine) std::free(area);
}

int Simulator::registerApplication(ZUB_APPL_ID* id, const char* name)
{
    if (id == nullptr) {
        report("ZUB1_RegisterApplication: null id pointer");
        return ZUB1SIM_RC_BAD_ARGUMENT;
    }
    std::optional<StatusWrite> status;
    {
        Lock lock(m_mutex);
        if (m_resetting || m_shutdown) {
            lock.unlock();
            report("ZUB1_RegisterApplication: refused while the library resets or ends");
            return ZUB1SIM_RC_BUSY;
        }
        if (!m_settingsRead) {
            m_settings = Settings::fromEnvironment();
            m_settingsRead = true;
            m_refusalsLeft = m_settings.registerFailures;
        }
        if (m_refusalsLeft > 0) {
            const long left = --m_refusalsLeft;
            ++m_stats.refusals;
            lock.unlock();
            report("ZUB1_RegisterApplication: refused as ZUB1_REGISTER_FAILURES asks (%ld more)", left);
            return ZUB1SIM_RC_REFUSED;
        }
        if (!m_started) startLocked();
        if (!m_started) return ZUB1SIM_RC_INTERNAL;

        while (m_nextApplId == 0 || m_appls.count(m_nextApplId) != 0) ++m_nextApplId;
        auto appl = std::make_shared<Application>();
        appl->id = m_nextApplId++;
        appl->name = name == nullptr ? "" : name;
        m_appls.emplace(appl->id, appl);
        if (m_openAppls++ == 0) {
            m_resumeAt = std::chrono::steady_clock::now() +
                         std::chrono::milliseconds(m_settings.startDelayMs);
        }
        ++m_stats.registrations;
        *id = appl->id;
        m_workCv.notify_all();
        status = progressLocked();
    }
    writeStatus(status);
    return 0;
}

void Simulator::startLocked()
{
    m_stop = false;
    m_scriptDone = m_settings.replayPath.empty();
    try {
        for (int i = 0; i < m_settings.threads; ++i) m_workers.emplace_back(&Simulator::workerLoop, this);
    } catch (const std::system_error& e) {
        report("cannot start a delivery thread: %s", e.what());
    }
    if (m_workers.empty()) return;
    if (!m_scriptDone) {
        try {
            m_replayThread = std::thread(&Simulator::replayLoop, this, m_settings.replayPath);
        } catch (const std::system_error& e) {
            report("%s: cannot start the replay thread: %s", m_settings.replayPath.c_str(), e.what());
            m_scriptDone = true;
        }
    }
    m_started = true;
    if (!m_atexitInstalled) {
        m_atexitInstalled = true;
        std::atexit(shutdownAtExit);
    }
}

int Simulator::defineFilter(ZUB_APPL_ID* id, const ZUB_FILTER_REQUEST* request)
{
    if (id == nullptr || request == nullptr) {
        report("ZUB1_DefineFilter: null id or request pointer");
        return ZUB1SIM_RC_BAD_ARGUMENT;
    }
    const std::string problem = checkRequest(*request);
    if (!problem.empty()) {
        report("ZUB1_DefineFilter: %s", problem.c_str());
        return ZUB1SIM_RC_BAD_REQUEST;
    }
    Lock lock(m_mutex);
    const auto found = m_appls.find(*id);
    if (found == m_appls.end() || found->second->closing) {
        const ZUB_APPL_ID unknown = *id;
        lock.unlock();
        report("ZUB1_DefineFilter: unknown application id <%u>", unknown);
        return ZUB1SIM_RC_UNKNOWN_APPL;
    }
    const std::shared_ptr<Application>& appl = found->second;
    if (request->requestType == ZUB_REQ_DEFINE_FILTER) {
        ++m_stats.defineRequests;
        // Delivery starts (or resumes) only a start delay after the last
        // definition, not after the registration alone: an application
        // defines its filters one after the other, and on a busy machine
        // the whole series can take longer than the delay.
        const auto settled = std::chrono::steady_clock::now() + std::chrono::milliseconds(m_settings.startDelayMs);
        if (settled > m_resumeAt)
            m_resumeAt = settled;
        // Defining the same protocol/service again replaces the callback.
        for (Filter& filter : m_filters) {
            if (filter.appl == appl && filter.protocol == request->protocol &&
                filter.service == request->service) {
                filter.callback = request->callback;
                return 0;
            }
        }
        if (m_nextFilterId == 0) ++m_nextFilterId;
        m_filters.push_back(
            Filter{m_nextFilterId++, appl, request->protocol, request->service, request->callback});
        return 0;
    }
    for (auto it = m_filters.begin(); it != m_filters.end(); ++it) {
        if (it->appl == appl && it->filterId == request->filterId) {
            m_filters.erase(it);
            return 0;
        }
    }
    const uint32_t filterId = request->filterId;
    lock.unlock();
    report("ZUB1_DefineFilter: application <%u> has no filter <%u>", *id, filterId);
    return ZUB1SIM_RC_UNKNOWN_FILTER;
}

int Simulator::freeResult(void* table)
{
    std::optional<StatusWrite> status;
    size_t size = 0;
    bool held = false;
    {
        Lock lock(m_mutex);
        const auto found = m_delivered.find(table);
        if (found != m_delivered.end()) {
            held = true;
            size = found->second.size;
            if (found->second.generation == m_generation) {
                ++m_stats.freed;
                ++m_version;
            }
            m_delivered.erase(found);
        } else {
            ++m_stats.badFrees;
            ++m_version;
        }
        status = progressLocked();
    }
    if (!held) {
        report("ZUB1_FreeResponseTimeResult: <%p> is not a delivered table, or was given back already",
               table);
    } else {
        release(table, size);
    }
    writeStatus(status);
    return held ? 0 : ZUB1SIM_RC_NOT_DELIVERED;
}

void Simulator::release(void* area, size_t size)
{
    if (QUARANTINE_TABLES == 0) {
        std::free(area);
        return;
    }
    // A reader that keeps using a given-back table sees garbage, not data.
    std::memset(area, 0xA5, size);
    void* oldest = nullptr;
    {
        Lock lock(m_mutex);
        m_quarantine.push_back(area);
        if (m_quarantine.size() > QUARANTINE_TABLES) {
            oldest = m_quarantine.front();
            m_quarantine.pop_front();
        }
    }
    std::free(oldest);
}

int Simulator::unregisterApplication(ZUB_APPL_ID* id)
{
    if (id == nullptr) {
        report("ZUB1_UnregisterApplication: null id pointer");
        return ZUB1SIM_RC_BAD_ARGUMENT;
    }
    Lock lock(m_mutex);
    const auto found = m_appls.find(*id);
    if (found == m_appls.end()) {
        const ZUB_APPL_ID unknown = *id;
        lock.unlock();
        report("ZUB1_UnregisterApplication: unknown application id <%u>", unknown);
        return ZUB1SIM_RC_UNKNOWN_APPL;
    }
    const std::shared_ptr<Application> appl = found->second;
    if (!appl->closing) {
        appl->closing = true;
        for (auto it = m_filters.begin(); it != m_filters.end();) {
            it = it->appl == appl ? m_filters.erase(it) : it + 1;
        }
        --m_openAppls;
        ++m_stats.unregistrations;
    }
    const bool inOwnCallback = t_callbackAppl == appl->id;
    ++appl->waiters;
    if (inOwnCallback) ++appl->waitersInCallback;
    m_applCv.notify_all();
    m_applCv.wait(lock, [&] { return appl->running <= appl->waitersInCallback; });
    if (inOwnCallback) --appl->waitersInCallback;
    if (--appl->waiters == 0) m_appls.erase(appl->id);
    return 0;
}

void Simulator::workerLoop()
{
    t_libraryThread = true;
    try {
        Lock lock(m_mutex);
        while (!m_stop) {
            if (m_queue.empty() || m_openAppls == 0 || m_held) {
                m_workCv.wait(lock);
                continue;
            }
            if (std::chrono::steady_clock::now() < m_resumeAt) {
                m_workCv.wait_until(lock, m_resumeAt);
                continue;
            }
            ScriptTable table = std::move(m_queue.front());
            m_queue.pop_front();
            m_spaceCv.notify_one();
            const Filter* filter = findFilterLocked(table.protocol, table.service);
            if (filter == nullptr) {
                ++m_stats.unmatched;
                ++m_version;
                std::optional<StatusWrite> status = progressLocked();
                lock.unlock();
                table.area.reset();
                writeStatus(status);
                lock.lock();
                continue;
            }
            const std::shared_ptr<Application> appl = filter->appl;
            const ZUB_CALLBACK callback = filter->callback;
            m_delivered.emplace(table.area.get(), Delivered{m_generation, table.size});
            void* area = table.area.release();
            ++m_stats.delivered;
            ++m_version;
            ++appl->running;
            ++m_callbacksRunning;
            lock.unlock();

            t_callbackAppl = appl->id;
            try {
                callback(area);
            } catch (...) {
                report("a callback of application <%u> threw an exception", appl->id);
            }
            t_callbackAppl = 0;

            lock.lock();
            --appl->running;
            --m_callbacksRunning;
            m_applCv.notify_all();
            std::optional<StatusWrite> status = progressLocked();
            if (status) {
                lock.unlock();
                writeStatus(status);
                lock.lock();
            }
        }
    } catch (const std::exception& e) {
        report("a delivery thread ends: %s", e.what());
    }
}

// Spaces replayed tables ZUB1_RATE per second apart. A replay held up for
// more than a second (no application registered, a full queue) goes on at
// the rate from then on instead of catching up in a burst, so that the load
// stays steady.
class Simulator::Pacer {
    using Clock = std::chrono::steady_clock;

public:
    explicit Pacer(double perSecond)
        : m_interval(perSecond > 0 ? std::chrono::duration_cast<Clock::duration>(
                                         std::chrono::duration<double>(1.0 / perSecond))
                                   : Clock::duration::zero())
    {
    }
    bool paced() const { return m_interval > Clock::duration::zero(); }
    // When the next table is due; moves the schedule on by one table.
    Clock::time_point next()
    {
        const Clock::time_point now = Clock::now();
        if (!m_started || now - m_due > std::chrono::seconds(1)) m_due = now;
        m_started = true;
        const Clock::time_point due = m_due;
        m_due += m_interval;
        return due;
    }

private:
    Clock::duration m_interval;
    Clock::time_point m_due;
    bool m_started = false;
};

void Simulator::replayLoop(std::string path)
{
    t_libraryThread = true;
    bool finished = true;
    try {
        finished = replay(path);
    } catch (const std::exception& e) {
        report("%s: replay ends: %s", path.c_str(), e.what());
    }
    if (!finished) return;  // stopped by a reset or the process end
    std::optional<StatusWrite> status;
    {
        Lock lock(m_mutex);
        m_scriptDone = true;
        status = progressLocked();
    }
    writeStatus(status);
}

// Replays `path` ZUB1_LOOPS times, or until stopped when that is 0. The file
// is a HAR capture or a table script, told apart by its first bytes; a
// capture is read and converted once, a script read again for each pass.
// A pass that queues no table ends the repetition, since none would ever
// come of it. Returns false when stopped.
bool Simulator::replay(const std::string& path)
{
    std::string start(4096, '\0');
    {
        std::ifstream in(path, std::ios::binary);
        if (!in) {
            report("%s: cannot open: %s", path.c_str(), std::strerror(errno));
            return true;
        }
        in.read(&start[0], static_cast<std::streamsize>(start.size()));
        start.resize(static_cast<size_t>(in.gcount()));
    }
    std::optional<HarReplay> har;
    if (looksLikeHar(start)) {
        std::ifstream in(path, std::ios::binary);
        const std::string content{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
        std::string error = in.bad() ? std::string("read error: ") + std::strerror(errno) : "";
        har.emplace();
        if (!error.empty() || !convertHar(content, *har, error)) {
            report("%s: not a HAR capture: %s", path.c_str(), error.c_str());
            countInvalid();
            return true;
        }
        for (const std::string& problem : har->problems) report("%s: %s", path.c_str(), problem.c_str());
    }
    Pacer pacer(m_settings.rate);
    for (long pass = 0; m_settings.loops == 0 || pass < m_settings.loops; ++pass) {
        uint64_t queued = 0;
        const bool goOn = har ? replayCapture(path, *har, pass == 0, pacer, queued)
                              : replayScript(path, pass == 0, pacer, queued);
        if (!goOn) {
            Lock lock(m_mutex);
            return !m_stop;
        }
        if (queued == 0) {
            if (m_settings.loops != 1) report("%s: nothing to replay; not repeated", path.c_str());
            break;
        }
    }
    return true;
}
// One pass over a table script. Invalid lines are counted in every pass and
// reported in the first. False when the replay is to end: stopped, or the
// script could not be read.
bool Simulator::replayScript(const std::string& path, bool firstPass, Pacer& pacer, uint64_t& queued)
{
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        report("%s: cannot open: %s", path.c_str(), std::strerror(errno));
        return false;
    }
    std::string line;
    unsigned long lineNo = 0;
    while (std::getline(in, line)) {
        ++lineNo;
        if (isSkippedLine(line)) continue;
        ScriptTable table;
        std::string error;
        if (!parseTableLine(line, table, error)) {
            if (firstPass) report("%s:%lu: %s", path.c_str(), lineNo, error.c_str());
            countInvalid();
            continue;
        }
        if (!queueReplayed(std::move(table), pacer)) return false;
        ++queued;
    }
    if (in.bad()) {
        report("%s:%lu: read error: %s", path.c_str(), lineNo + 1, std::strerror(errno));
        return false;
    }
    return true;
}

// One pass over a converted capture.
bool Simulator::replayCapture(const std::string& path, const HarReplay& har, bool firstPass, Pacer& pacer,
                              uint64_t& queued)
{
    {
        Lock lock(m_mutex);
        m_stats.entries += har.entries;
        m_stats.skipped += har.skipped;
        ++m_version;
    }
    size_t index = 0;
    for (const nlohmann::json& doc : har.tables) {
        ++index;
        ScriptTable table;
        std::string error;
        // Fails only when memory runs out, or for a value the conversion
        // should not have let through.
        if (!buildTable(doc, table, error)) {
            if (firstPass) report("%s: table %zu: %s", path.c_str(), index, error.c_str());
            countInvalid();
            continue;
        }
        if (!queueReplayed(std::move(table), pacer)) return false;
        ++queued;
    }
    return true;
}

// Queues a replayed table when it is due and the queue has room; false when
// stopped first.
bool Simulator::queueReplayed(ScriptTable table, Pacer& pacer)
{
    Lock lock(m_mutex);
    if (pacer.paced()) m_spaceCv.wait_until(lock, pacer.next(), [&] { return m_stop; });
    m_spaceCv.wait(lock, [&] { return m_stop || m_queue.size() < REPLAY_QUEUE_LIMIT; });
    if (m_stop) return false;
    enqueueLocked(std::move(table));
    return true;
}

void Simulator::countInvalid()
{
    Lock lock(m_mutex);
    ++m_stats.invalid;
    ++m_version;
}

void Simulator::enqueueLocked(ScriptTable table)
{
    m_queue.push_back(std::move(table));
    ++m_stats.tables;
    ++m_version;
    m_workCv.notify_one();
}

const Simulator::Filter* Simulator::findFilterLocked(uint16_t protocol, uint16_t service) const
{
    for (const Filter& filter : m_filters) {
        if (filter.protocol == protocol && filter.service == service) return &filter;
    }
    return nullptr;
}

bool Simulator::idleLocked() const
{
    // A callback may still run after it gave its table back; idle waits for
    // it to return, so that a waiter sees everything the callback did.
    return m_started && m_scriptDone && m_queue.empty() && m_stats.delivered == m_stats.freed &&
           m_callbacksRunning == 0;
}

// Called after every change that may have made the simulator idle: wakes
// the waiters and, with a status file, hands out the status to write once
// the lock is released.
std::optional<Simulator::StatusWrite> Simulator::progressLocked()
{
    if (!idleLocked()) return std::nullopt;
    m_idleCv.notify_all();
    if (m_settings.statusFile.empty() || m_statusQueued >= m_version) return std::nullopt;
    m_statusQueued = m_version;
    return StatusWrite{m_settings.statusFile, statsLocked(), m_version};
}

void Simulator::writeStatus(const std::optional<StatusWrite>& write)
{
    if (!write) return;
    {
        // Two idle moments in quick succession may race here; the older
        // status must not overwrite the newer one.
        std::lock_guard<std::mutex> guard(m_statusMutex);
        if (write->version > m_statusFileVersion) {
            writeStatusFile(write->path, write->stats);
            m_statusFileVersion = write->version;
        }
    }
    Lock lock(m_mutex);
    if (write->version > m_statusWritten) m_statusWritten = write->version;
    m_idleCv.notify_all();
}

ZUB1SIM_STATS Simulator::statsLocked() const
{
    ZUB1SIM_STATS stats = m_stats;
    stats.filtersDefined = m_filters.size();
    return stats;
}

std::vector<std::thread> Simulator::takeThreadsLocked()
{
    std::vector<std::thread> threads = std::move(m_workers);
    m_workers.clear();
    if (m_replayThread.joinable()) threads.push_back(std::move(m_replayThread));
    m_workCv.notify_all();
    m_spaceCv.notify_all();
    return threads;
}

int Simulator::reset()
{
    std::vector<std::thread> threads;
    {
        Lock lock(m_mutex);
        const char* refusal = nullptr;
        if (t_libraryThread) refusal = "called on a library thread";
        else if (!m_appls.empty()) refusal = "an application is still registered";
        else if (m_resetting || m_shutdown) refusal = "the library resets or ends already";
        if (refusal != nullptr) {
            lock.unlock();
            report("ZUB1SIM_Reset: refused: %s", refusal);
            return -1;
        }
        m_resetting = true;
        m_stop = true;
        threads = takeThreadsLocked();
    }
    for (std::thread& thread : threads) thread.join();
    std::deque<ScriptTable> dropped;
    {
        Lock lock(m_mutex);
        dropped.swap(m_queue);
        m_filters.clear();
        m_stats = ZUB1SIM_STATS{};
        ++m_generation;
        ++m_version;
        m_deliverLineCalls = 0;
        m_settingsRead = false;
        m_started = false;
        m_scriptDone = false;
        m_stop = false;
        m_held = false;
        m_resetting = false;
    }
    return 0;
}

void Simulator::shutdown()
{
    std::vector<std::thread> threads;
    {
        Lock lock(m_mutex);
        m_shutdown = true;
        m_stop = true;
        threads = takeThreadsLocked();
    }
    for (std::thread& thread : threads) {
        // exit() called from inside a callback cannot wait for its own thread.
        if (thread.get_id() == std::this_thread::get_id()) {
            thread.detach();
        } else {
            thread.join();
        }
    }
}

void Simulator::getStats(ZUB1SIM_STATS* stats)
{
    if (stats == nullptr) return;
    Lock lock(m_mutex);
    *stats = statsLocked();
}

int Simulator::waitIdle(int timeoutMs)
{
    if (t_libraryThread) {
        report("ZUB1SIM_WaitIdle: called on a library thread, which the wait would block");
        return -1;
    }
    Lock lock(m_mutex);
    const auto done = [&] {
        return idleLocked() && (m_settings.statusFile.empty() || m_statusWritten >= m_version);
    };
    if (timeoutMs < 0) {
        m_idleCv.wait(lock, done);
        return 0;
    }
    return m_idleCv.wait_for(lock, std::chrono::milliseconds(timeoutMs), done) ? 0 : -1;
}

int Simulator::deliverLine(const char* line)
{
    uint64_t call = 0;
    {
        Lock lock(m_mutex);
        call = ++m_deliverLineCalls;
    }
    ScriptTable table;
    std::string error = "null line";
    const bool valid = line != nullptr && parseTableLine(line, table, error);
    if (!valid) report("ZUB1SIM_DeliverLine:%llu: %s", static_cast<unsigned long long>(call), error.c_str());
    std::optional<StatusWrite> status;
    {
        Lock lock(m_mutex);
        if (valid) {
            enqueueLocked(std::move(table));
            return 0;
        }
        ++m_stats.invalid;
        ++m_version;
        status = progressLocked();
    }
    writeStatus(status);
    return -1;
}

void Simulator::holdDelivery(bool hold)
{
    Lock lock(m_mutex);
    m_held = hold;
    m_workCv.notify_all();
}

int Simulator::getFilters(ZUB1SIM_FILTER* filters, int capacity)
{
    Lock lock(m_mutex);
    const int count = static_cast<int>(m_filters.size());
    for (int i = 0; filters != nullptr && i < capacity && i < count; ++i) {
        const Filter& filter = m_filters[static_cast<size_t>(i)];
        filters[i] = ZUB1SIM_FILTER{filter.appl->id, filter.filterId, filter.protocol, filter.service,
                                    filter.callback};
    }
    return count;
}

}  // namespace zub1sim
