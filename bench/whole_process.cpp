// Part G: build/wq5collector with the simulated collection library
// replaying a capture of the benchmark's page in a loop, unpaced, measured from
// outside: records per second from start until the library reports every
// table given back, and the process's resident memory at that moment.
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "parts.h"
#include "workload.h"

extern char** environ;

namespace wq5bench {

namespace {

// Waits until `dir/name` exists; re-checks whenever an entry of `dir` is
// created or renamed into it. False when `timeout` passed first or the
// process `pid` ended.
bool waitForFile(const std::string& dir, const std::string& name, pid_t pid, std::chrono::seconds timeout)
{
    const int fd = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    if (fd >= 0)
        inotify_add_watch(fd, dir.c_str(), IN_CREATE | IN_MOVED_TO);
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    const std::string path = dir + "/" + name;
    struct stat status;
    bool found = stat(path.c_str(), &status) == 0;
    while (!found && std::chrono::steady_clock::now() < deadline && waitpid(pid, nullptr, WNOHANG) == 0) {
        struct pollfd ready = {fd, POLLIN, 0};
        poll(&ready, 1, 100);  // the timeout only notices an ended process
        char events[4096];
        while (fd >= 0 && read(fd, events, sizeof events) > 0) {
        }
        found = stat(path.c_str(), &status) == 0;
    }
    if (fd >= 0)
        close(fd);
    return found;
}

// A "VmXXX:  1234 kB" line of /proc/<pid>/status, in KiB; -1 when absent.
long statusKiB(pid_t pid, const char* field)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    const std::string prefix = std::string(field) + ":";
    for (std::string line; std::getline(in, line);)
        if (line.compare(0, prefix.size(), prefix) == 0)
            return std::strtol(line.c_str() + prefix.size(), nullptr, 10);
    return -1;
}

// Lines and bytes of every file in `dir`.
void countLog(const std::string& dir, long* lines, double* bytes)
{
    *lines = 0;
    *bytes = 0;
    std::vector<char> block(1 << 16);
    for (const auto& file : std::filesystem::directory_iterator(dir)) {
        std::ifstream in(file.path(), std::ios::binary);
        while (in.read(block.data(), static_cast<std::streamsize>(block.size())) || in.gcount() > 0) {
            const char* data = block.data();
            for (std::streamsize i = 0; i < in.gcount(); ++i)
                *lines += data[i] == '\n';
            *bytes += static_cast<double>(in.gcount());
        }
    }
}

// The environment of the collector: ours without any setting of the
// collector, its two libraries or a sanitizer runtime, plus `settings`.
std::vector<std::string> collectorEnvironment(const std::vector<std::string>& settings)
{
    std::vector<std::string> env;
    for (char** e = environ; *e != nullptr; ++e) {
        const std::string entry = *e;
        if (entry.rfind("WQ5_", 0) != 0 && entry.rfind("ZUB1_", 0) != 0 && entry.rfind("MOQ_", 0) != 0)
            env.push_back(entry);
    }
    env.insert(env.end(), settings.begin(), settings.end());
    return env;
}

}  // namespace

ProcessRun runWholeProcess(const std::string& collector, long tables)
{
    ProcessRun run;
    run.tables = tables;
    TempDir dir("G");
    const std::string& base = dir.path();
    mkdir((base + "/log").c_str(), 0755);

    // The benchmark's page as a capture, which the library converts once
    // into one table and then replays `tables` times.
    const std::string script = base + "/page.har";
    {
        std::ofstream out(script, std::ios::binary);
        out << captureHar();
    }

    std::vector<std::string> env = collectorEnvironment({
        "WQ5_WORK_PATH=" + base, "WQ5_COLLECTOR_ID=bench01", "WQ5_LOG_DIR=log", "WQ5_LOG_HTTP=Y",
        "WQ5_LOG_HTTPOBJ=Y", "ZUB1_REPLAY=" + script, "ZUB1_LOOPS=" + std::to_string(tables), "ZUB1_STATUS_FILE=" + base + "/status.json",
        "ZUB1_START_DELAY_MS=0", "MOQ_TRACE_FILE=" + base + "/trace.log"});
    std::vector<char*> envp;
    for (std::string& e : env)
        envp.push_back(&e[0]);
    envp.push_back(nullptr);
    char* argv[] = {const_cast<char*>(collector.c_str()), nullptr};

    const auto start = std::chrono::steady_clock::now();
    pid_t pid;
    if (posix_spawn(&pid, collector.c_str(), nullptr, nullptr, argv, envp.data()) != 0) {
        run.problem = "cannot start " + collector;
        return run;
    }
    const bool idle = waitForFile(base, "status.json", pid, std::chrono::seconds(600));
    run.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    run.peakKiB = statusKiB(pid, "VmHWM");
    run.residentKiB = statusKiB(pid, "VmRSS");
    kill(pid, SIGTERM);
    int status = 0;
    waitpid(pid, &status, 0);

    long lines = 0;
    double bytes = 0;
    countLog(base + "/log", &lines, &bytes);
    const long expected = tables * RECORDS_PER_TABLE;
    if (!idle)
        run.problem = "the library never reported every table given back";
    else if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
        run.problem = "the collector did not stop with status 0";
    else if (lines != expected)
        run.problem = "the log holds " + std::to_string(lines) + " records, not " + std::to_string(expected);
    run.complete = run.problem.empty();
    run.recordsPerSecond = static_cast<double>(lines) / run.seconds;
    run.megabytesPerSecond = bytes / run.seconds / 1e6;
    return run;
}

}  // namespace wq5bench
