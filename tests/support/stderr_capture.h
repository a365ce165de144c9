// Sends the test's standard error to a file while it lives: messages of the
// library under test land there, and so do those of a child process started
// meanwhile, which inherits the descriptor.
#ifndef WQ5_TESTS_STDERR_CAPTURE_H
#define WQ5_TESTS_STDERR_CAPTURE_H

#include <cstdio>
#include <map>
#include <optional>
#include <string>

#include <fcntl.h>
#include <unistd.h>

#include "support/process.h"

namespace wq5test {

class StderrCapture {
public:
    explicit StderrCapture(std::string path) : m_path(std::move(path))
    {
        std::fflush(stderr);
        m_saved = dup(2);
        const int fd = open(m_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        dup2(fd, 2);
        close(fd);
    }
    ~StderrCapture() { restore(); }
    StderrCapture(const StderrCapture&) = delete;
    StderrCapture& operator=(const StderrCapture&) = delete;

    // Gives standard error back and returns what was written meanwhile.
    std::string text()
    {
        restore();
        return readFile(m_path);
    }

private:
    void restore()
    {
        if (m_saved < 0) return;
        std::fflush(stderr);
        dup2(m_saved, 2);
        close(m_saved);
        m_saved = -1;
    }
    std::string m_path;
    int m_saved = -1;
};

// Starts the collector with every traffic kind switched on (added to
// `env`), its standard error going to `stderrPath`.
inline void startAllKinds(std::optional<Collector>& collector, std::map<std::string, std::string> env,
                          const std::string& stderrPath)
{
    for (const char* kind : {"HTTP", "HTTPOBJ", "HTTPS", "MS_VIDEO", "MS_AUDIO", "REAL_VIDEO", "REAL_AUDIO", "QUICKTIME"})
        env[std::string("WQ5_LOG_") + kind] = "Y";
    StderrCapture errors(stderrPath);
    collector.emplace(collectorBinary(), env);
}

}  // namespace wq5test

#endif
