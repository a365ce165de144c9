// Starting the real collector from a test, waiting for what it writes, and
// collecting its exit status, without fixed sleeps: waits end as soon as
// the awaited file content appears (inotify), with a generous timeout that
// only catches hangs.
#ifndef WQ5_TESTS_PROCESS_H
#define WQ5_TESTS_PROCESS_H

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/inotify.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "support/spawn_program.h"

extern char** environ;

namespace wq5test {

inline std::string readFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

inline void writeFile(const std::string& path, const std::string& content)
{
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
}

inline std::string makeTempDir()
{
    char pattern[] = "/tmp/wq5test.XXXXXX";
    const char* dir = mkdtemp(pattern);
    return dir != nullptr ? std::string(dir) : std::string();
}

inline void removeTree(const std::string& dir)
{
    if (dir.rfind("/tmp/wq5test.", 0) == 0)
        (void)!std::system(("rm -rf '" + dir + "'").c_str());
}

// Waits until `ready()` holds, re-checking whenever something changes in
// `dir`. Returns false when `timeout` passed first.
inline bool waitFor(const std::string& dir, const std::function<bool()>& ready,
                    std::chrono::milliseconds timeout = std::chrono::seconds(60))
{
    const int fd = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    if (fd >= 0)
        inotify_add_watch(fd, dir.c_str(), IN_CREATE | IN_MODIFY | IN_MOVED_TO | IN_CLOSE_WRITE | IN_DELETE);
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    bool ok = ready();
    while (!ok && std::chrono::steady_clock::now() < deadline) {
        struct pollfd p = {fd, POLLIN, 0};
        // The poll timeout is only a fallback should an event be missed.
        poll(&p, 1, 250);
        char drain[4096];
        while (fd >= 0 && read(fd, drain, sizeof(drain)) > 0) {
        }
        ok = ready();
    }
    if (fd >= 0)
        close(fd);
    return ok;
}

// Number of occurrences of `text` in the file at `path`.
inline int countIn(const std::string& path, const std::string& text)
{
    const std::string content = readFile(path);
    int n = 0;
    for (size_t at = content.find(text); at != std::string::npos; at = content.find(text, at + text.size()))
        ++n;
    return n;
}

// A child process running the collector with a chosen environment.
class Collector {
public:
    // `env` is added to (and overrides) the test's own environment; a value
    // of "\x01unset" removes the variable.
    Collector(const std::string& binary, const std::map<std::string, std::string>& env)
    {
        std::map<std::string, std::string> all;
        for (char** e = environ; *e != nullptr; ++e) {
            std::string entry(*e);
            const size_t eq = entry.find('=');
            if (eq != std::string::npos)
                all[entry.substr(0, eq)] = entry.substr(eq + 1);
        }
        for (const auto& kv : env) {
            if (kv.second == "\x01unset")
                all.erase(kv.first);
            else
                all[kv.first] = kv.second;
        }
        for (const auto& kv : all)
            m_env.push_back(kv.first + "=" + kv.second);
        std::vector<char*> envp;
        for (std::string& s : m_env)
            envp.push_back(&s[0]);
        envp.push_back(nullptr);
        std::string arg0 = binary;
        char* argv[] = {&arg0[0], nullptr};
        if (spawnProgram(&m_pid, binary.c_str(), nullptr, argv, envp.data()) != 0)
            m_pid = -1;
    }

    ~Collector()
    {
        if (m_pid > 0 && !m_reaped) {
            kill(m_pid, SIGKILL);
            waitpid(m_pid, nullptr, 0);
        }
    }

    Collector(const Collector&) = delete;
    Collector& operator=(const Collector&) = delete;

    bool started() const { return m_pid > 0; }
    void signal(int sig) { kill(m_pid, sig); }

    // Waits for the process to end; the raw wait status, or -1 on timeout.
    // The exit is observed through a process file descriptor.
    int wait(std::chrono::seconds timeout = std::chrono::seconds(60))
    {
        const int pidfd = static_cast<int>(syscall(SYS_pidfd_open, m_pid, 0));
        if (pidfd >= 0) {
            struct pollfd p = {pidfd, POLLIN, 0};
            const int ready = poll(&p, 1, static_cast<int>(timeout.count() * 1000));
            close(pidfd);
            if (ready <= 0)
                return -1;
        }
        int status = 0;
        if (waitpid(m_pid, &status, 0) != m_pid)
            return -1;
        m_reaped = true;
        return status;
    }

private:
    pid_t m_pid = -1;
    bool m_reaped = false;
    std::vector<std::string> m_env;
};

inline std::string collectorBinary()
{
    return std::string(WQ5_BUILD_DIR) + "/wq5collector";
}

}  // namespace wq5test

#endif
