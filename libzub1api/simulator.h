// The simulated collection library: applications, filters, the queue of
// tables waiting for delivery, the delivery threads and the counters.
//
// One lock (m_mutex) guards all of it. It is never held while a callback
// runs, while a file is read or written, or while a thread is joined.
#ifndef WQ5_LIBZUB1API_SIMULATOR_H
#define WQ5_LIBZUB1API_SIMULATOR_H

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "libzub1api/har.h"
#include "libzub1api/tablescript.h"
#include "libzub1api/zub1sim.h"
#include "zub/zub1api.h"

namespace zub1sim {

// Writes "zub1api: <message>\n" to stderr in one piece.
void report(const char* format, ...) __attribute__((format(printf, 1, 2)));

// The ZUB1_* environment settings, read at the first registration.
struct Settings {
    std::string replayPath;        // ZUB1_REPLAY; empty: no script
    long loops = 1;                // ZUB1_LOOPS; 0: until stopped
    double rate = 0;               // ZUB1_RATE, tables per second; 0: unpaced
    int threads = 2;               // ZUB1_THREADS
    int startDelayMs = 200;        // ZUB1_START_DELAY_MS
    std::string statusFile;        // ZUB1_STATUS_FILE; empty: none
    long registerFailures = 0;     // ZUB1_REGISTER_FAILURES

    static Settings fromEnvironment();
};

class Simulator {
public:
    Simulator() = default;
    ~Simulator();
    Simulator(const Simulator&) = delete;
    Simulator& operator=(const Simulator&) = delete;

    int registerApplication(ZUB_APPL_ID* id, const char* name);
    int defineFilter(ZUB_APPL_ID* id, const ZUB_FILTER_REQUEST* request);
    int freeResult(void* table);
    int unregisterApplication(ZUB_APPL_ID* id);

    int reset();
    void getStats(ZUB1SIM_STATS* stats);
    int waitIdle(int timeoutMs);
    int deliverLine(const char* line);
    int getFilters(ZUB1SIM_FILTER* filters, int capacity);
    void holdDelivery(bool hold);

    // Stops and joins the threads for good (process exit, library unload).
    void shutdown();

private:
    struct Application {
        ZUB_APPL_ID id = 0;
        std::string name;
        bool closing = false;       // unregistration begun: no new callbacks
        int running = 0;            // callbacks of it in progress
        int waiters = 0;            // threads inside its unregistration
        int waitersInCallback = 0;  // of those, the ones inside its own callback
    };
    struct Filter {
        uint32_t filterId;
        std::shared_ptr<Application> appl;
        uint16_t protocol;
        uint16_t service;
        ZUB_CALLBACK callback;
    };
    struct Delivered {
        uint64_t generation;  // tables of before a reset are taken back uncounted
        size_t size;
    };
    struct StatusWrite {
        std::string path;
        ZUB1SIM_STATS stats;
        uint64_t version;
    };
    using Lock = std::unique_lock<std::mutex>;

    void startLocked();
    void workerLoop();
    class Pacer;
    void replayLoop(std::string path);
    bool replay(const std::string& path);
    bool replayScript(const std::string& path, bool firstPass, Pacer& pacer, uint64_t& queued);
    bool replayCapture(const std::string& path, const HarReplay& har, bool firstPass, Pacer& pacer,
                       uint64_t& queued);
    bool queueReplayed(ScriptTable table, Pacer& pacer);
    void countInvalid();
    void enqueueLocked(ScriptTable table);
    const Filter* findFilterLocked(uint16_t protocol, uint16_t service) const;
    bool idleLocked() const;
    std::optional<StatusWrite> progressLocked();
    void writeStatus(const std::optional<StatusWrite>& write);
    ZUB1SIM_STATS statsLocked() const;
    std::vector<std::thread> takeThreadsLocked();
    void release(void* area, size_t size);

    std::mutex m_mutex;
    std::condition_variable m_workCv;   // workers: queue, registrations, stop
    std::condition_variable m_spaceCv;  // replay thread: room in the queue, stop
    std::condition_variable m_applCv;   // unregistrations: callbacks ending
    std::condition_variable m_idleCv;   // ZUB1SIM_WaitIdle

    Settings m_settings;
    bool m_settingsRead = false;
    long m_refusalsLeft = 0;
    bool m_started = false;      // threads started since the last reset
    bool m_scriptDone = false;   // the replay thread has done every pass
    bool m_stop = false;         // threads are to end (reset, shutdown)
    bool m_resetting = false;
    bool m_shutdown = false;
    bool m_atexitInstalled = false;
    bool m_held = false;         // ZUB1SIM_HoldDelivery

    std::map<ZUB_APPL_ID, std::shared_ptr<Application>> m_appls;
    int m_openAppls = 0;  // registered and not closing
    ZUB_APPL_ID m_nextApplId = 1;
    std::vector<Filter> m_filters;  // definition order
    uint32_t m_nextFilterId = 1;

    std::deque<ScriptTable> m_queue;
    std::chrono::steady_clock::time_point m_resumeAt;  // delivery waits until then
    std::unordered_map<void*, Delivered> m_delivered;  // handed out, not given back
    int m_callbacksRunning = 0;                        // of every application
    std::deque<void*> m_quarantine;                    // given back, not yet freed
    uint64_t m_generation = 1;
    uint64_t m_deliverLineCalls = 0;

    ZUB1SIM_STATS m_stats{};
    uint64_t m_version = 0;        // bumped by every change of the table counters
    uint64_t m_statusQueued = 0;   // version whose status write has been started
    uint64_t m_statusWritten = 0;  // version whose status write has ended

    std::mutex m_statusMutex;           // serialises status file writes
    uint64_t m_statusFileVersion = 0;   // guarded by m_statusMutex

    std::vector<std::thread> m_workers;
    std::thread m_replayThread;
};

// The process-wide simulator behind the C entry points.
Simulator& simulator();

}  // namespace zub1sim

#endif
