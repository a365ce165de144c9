#include "mmainunx.h"

#include <atomic>
#include <cerrno>
#include <exception>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include "mfmgr.h"
#include "platform/moq.h"

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mmainunx");
static TRC1_EPB s_quitBlock = TRC1_BLOCK_INIT(s_unit, "pvoquit");

// The only state shared with the signal handler. Lock-free, so it may be
// written from the handler and read from the control thread.
static std::atomic<bool> quit(false);
static_assert(std::atomic<bool>::is_always_lock_free, "quit flag must be usable from a signal handler");

// Self-pipe: the handler writes one byte so that the control loop's
// 5-second wait ends at once, whichever thread the signal was delivered to.
// Without it the loop would notice the flag only at its next pass.
static int s_wakePipe[2] = {-1, -1};

// Seconds between two registration checks.
static const int CONTROL_PERIOD_MS = 5000;

void pvoquit(int)
{
    // Only async-signal-safe work here; the handler's trace lines are
    // written by the control thread (traceShutdown).
    const int savedErrno = errno;
    quit.store(true);
    if (s_wakePipe[1] >= 0) {
        ssize_t ignored = write(s_wakePipe[1], "q", 1);
        (void)ignored;  // a full pipe already holds a wake-up
    }
    errno = savedErrno;
}

void catch_signal()
{
    struct sigaction action;
    action.sa_handler = pvoquit;
    sigemptyset(&action.sa_mask);
    action.sa_flags = 0;  // no SA_RESTART: the signal cuts a wait short
    if (sigaction(SIGTERM, &action, nullptr) != 0)
        exit(-1);
}

// Traces what the handler did, on its behalf, before the manager is
// destroyed: entry, "Shutting down WQ5 Collector..." and exit of pvoquit.
static void traceShutdown()
{
    const int mask = trc1Mask(&s_quitBlock);
    const bool entered = (mask & TRC_FLOW) != 0;
    if (entered)
        TRC1_Event(&s_quitBlock, __LINE__, TRC1_ENTRY);
    if (mask & TRC_FLOW)
        TRC1_Printf(&s_quitBlock, __LINE__, "Shutting down WQ5 Collector...");
    if (entered)
        TRC1_Event(&s_quitBlock, __LINE__, TRC1_EXIT);
}

// Waits up to one control period, or until SIGTERM wakes the loop.
static void waitForNextPass()
{
    struct pollfd wake;
    wake.fd = s_wakePipe[0];  // a negative fd is ignored: a plain timeout
    wake.events = POLLIN;
    wake.revents = 0;
    poll(&wake, 1, CONTROL_PERIOD_MS);
}

// The manager, built on first use. A failure (a mutex that cannot be made)
// is traced and tried again at the next pass instead of ending the thread.
static FilterManager* obtainManager()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "control_loop");
    try {
        return FilterManager::instance();
    } catch (const std::exception& e) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: collector cannot be set up: %s", e.what());
        return nullptr;
    }
}

static void keepRegistered(FilterManager* manager)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "control_loop");
    try {
        if (!manager->isConnected())
            manager->connect();
    } catch (const std::exception& e) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: registration failed: %s", e.what());
    }
}

void* control_loop(void*)
{
    FilterManager* manager = obtainManager();
    while (!quit.load()) {
        if (manager == nullptr)
            manager = obtainManager();
        if (manager != nullptr)
            keepRegistered(manager);
        waitForNextPass();
    }
    traceShutdown();
    return nullptr;
}

int main(int, char**)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "pvomain");
    const int mask = trc1Mask(&blk);
    const bool entered = (mask & TRC_FLOW) != 0;
    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_ENTRY);

    int status = 0;
    const char* workPath = QEN1_GetEnv("WQ5_WORK_PATH", nullptr);
    if (mask & TRC_FLOW)
        TRC1_Printf(&blk, __LINE__, "Starting WQ5 Collector...");
    if (workPath != nullptr && workPath[0] != '\0' && chdir(workPath) != 0) {
        // The collector goes on in its start directory, but an operator
        // must learn why the logs are not where the setting says.
        if (mask & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: cannot change to WQ5_WORK_PATH <%s> errno <%d>", workPath, errno);
    }

    if (pipe2(s_wakePipe, O_CLOEXEC | O_NONBLOCK) != 0) {
        s_wakePipe[0] = -1;
        s_wakePipe[1] = -1;
    }
    catch_signal();

    pthread_t control;
    if (pthread_create(&control, nullptr, control_loop, nullptr) == 0) {
        if (mask & TRC_FLOW)
            TRC1_Printf(&blk, __LINE__, "WQ5 Collector starts up successfully.");
        pthread_join(control, nullptr);
        FilterManager::destroyInstance();
    } else {
        status = -1;
    }

    if (mask & TRC_FLOW)
        TRC1_Printf(&blk, __LINE__, "WQ5 Collector stopped.");
    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_EXIT_VALUE, status);
    return status;
}
