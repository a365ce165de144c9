// The real collector, fed without end at a steady rate, against a full file
// system, a log directory taken away and one it may not write to: records
// are dropped whole and each one is reported, no file is left holding a
// piece of a record, writing resumes by itself, and the number of lost
// records it traces is the number dropped. Every record carries the next
// GUID counter, so the records found plus those dropped must add up.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/process.h"

namespace {

using namespace wq5test;

const uid_t NOBODY = 65534;
const std::string FAILED_WRITE = "Write to log file failed ";
const std::string FAILED_OPEN = "Failed to open log file.";
const std::string RESUMED = "Log file writing resumed; ";
#ifdef WQ5_EMULATOR
const char* const EMULATOR = WQ5_EMULATOR;  // would be handed a start script as its program
#else
const char* const EMULATOR = nullptr;
#endif
const std::string HEAD = "<video>v121^92^0^wq5coll^";
// Every record of the script, its GUID masked to "*".
const std::string RECORD = HEAD + "*^0^^^0^^^0^^0^0^0^0^0^0^0^0^0^5^N/A^N/A^N/A^N/A^N/A^7^0^0</video>\n";

bool shell(const std::string& command)
{
    return std::system((command + " >/dev/null 2>&1").c_str()) == 0;
}

// The GUID counter of `line`, or -1 when it is not a whole record.
long counterOf(const std::string& line)
{
    const size_t end = line.find("wq5coll^", HEAD.size());
    if (line.compare(0, HEAD.size(), HEAD) != 0 || end == std::string::npos || end < HEAD.size() + 8 ||
        line.find_first_not_of("0123456789abcdef", HEAD.size()) != end)
        return -1;
    std::string masked = line;
    masked.replace(HEAD.size(), end + 7 - HEAD.size(), "*");
    return masked == RECORD ? strtol(line.substr(end - 8, 8).c_str(), nullptr, 16) : -1;
}

// The counters of the records in `content`, in order. While the collector
// writes, a reader may catch a record being written or cut off: only a
// `strict` reading fails the test for a line that is not a whole record.
std::vector<long> counters(const std::string& content, bool strict)
{
    std::vector<long> found;
    for (size_t at = 0, end; at < content.size(); at = end) {
        end = std::min(content.find('\n', at), content.size() - 1) + 1;
        const long n = counterOf(content.substr(at, end - at));
        if (n >= 0 && (found.empty() || n > found.back()))
            found.push_back(n);
        else if (strict)
            ADD_FAILURE() << "not a whole record in its place: " << content.substr(at, std::min<size_t>(200, end - at));
    }
    return found;
}

class FaultRun : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_dir = makeTempDir();
        ASSERT_FALSE(m_dir.empty());
        m_out = m_dir + "/out";
        m_logDir = m_dir + "/log";
        ASSERT_EQ(0, mkdir(m_out.c_str(), 0755));
        std::string script;
        for (int i = 0; i < 10; ++i)
            script += "{\"filter\":[1,0],\"entries\":[{\"rdType\":\"MSVD\",\"mediaInt0\":7}]}\n";
        writeFile(m_out + "/script.jsonl", script);
    }
    void TearDown() override
    {
        if (m_inner > 0)
            kill(m_inner, SIGKILL);
        m_collector.reset();
        for (int fd : m_held)
            close(fd);
        removeTree(m_dir);
    }

    // Starts `binary` (the collector, or a script ending in it) replaying
    // the script again and again, 1000 tables a second, on one thread.
    void start(const std::string& binary, const std::string& maxSizeMb = "\x01unset")
    {
        std::map<std::string, std::string> env = {
            {"MOQ_TRACE", "error"}, {"MOQ_TRACE_FILE", m_out + "/trace.log"}, {"WQ5_COLLECTOR_ID", "wq5coll"},
            {"WQ5_LOG_DIR", m_logDir}, {"WQ5_LOG_MS_VIDEO", "Y"}, {"WQ5_LOG_MAX_SIZE_MB", maxSizeMb},
            {"ZUB1_REPLAY", m_out + "/script.jsonl"}, {"ZUB1_LOOPS", "0"}, {"ZUB1_RATE", "1000"},
            {"ZUB1_THREADS", "1"}, {"ZUB1_START_DELAY_MS", "\x01unset"}};
        for (char** e = environ; *e != nullptr; ++e)  // no other setting of ours
            if (strncmp(*e, "WQ5_", 4) == 0 || strncmp(*e, "ZUB1_", 5) == 0)
                env.emplace(std::string(*e, strcspn(*e, "=")), "\x01unset");
        m_collector.reset(new Collector(binary, env));
        ASSERT_TRUE(m_collector->started());
    }

    std::string writeScript(const std::string& body)
    {
        const std::string path = m_dir + "/run.sh";
        writeFile(path, "#!/bin/sh\n" + body + "\n");
        chmod(path.c_str(), 0755);
        return path;
    }

    std::string logPath() const { return m_root + m_logDir; }

    std::vector<std::string> logFiles() const
    {
        std::vector<std::string> names;
        if (DIR* dir = opendir(logPath().c_str())) {
            while (const dirent* e = readdir(dir))
                if (e->d_name[0] != '.')
                    names.push_back(e->d_name);
            closedir(dir);
        }
        std::sort(names.begin(), names.end());
        return names;
    }

    std::vector<long> logCounters(bool strict) const
    {
        std::vector<long> all;
        for (const std::string& name : logFiles())
            for (long n : counters(readFile(logPath() + "/" + name), strict))
                all.push_back(n);
        return all;
    }

    int traced(const std::string& text) const { return countIn(m_out + "/trace.log", text); }

    void waitUntil(const std::string& dir, const std::function<bool()>& ready, const char* what)
    {
        ASSERT_TRUE(waitFor(dir, ready)) << "never: " << what << "\n" << readFile(m_out + "/trace.log").substr(0, 2000);
    }

    // Each "resumed" line must follow exactly as many reports of dropped
    // records as it counts, and every dropped record must be counted in
    // one. Returns the number of runs of failures.
    int runsOfFailures() const
    {
        int runs = 0;
        long since = 0;
        const std::string trace = readFile(m_out + "/trace.log");
        for (size_t at = 0, end; at < trace.size(); at = end + 1) {
            end = std::min(trace.find('\n', at), trace.size());
            const std::string line = trace.substr(at, end - at);
            if (line.find(FAILED_WRITE) != std::string::npos || line.find(FAILED_OPEN) != std::string::npos)
                ++since;
            const size_t resumed = line.find(RESUMED);
            if (resumed != std::string::npos) {
                EXPECT_EQ(std::to_string(since) + " records lost.", line.substr(resumed + RESUMED.size()));
                since = 0;
                ++runs;
            }
        }
        EXPECT_EQ(0, since) << "dropped records never counted as lost";
        return runs;
    }

    // No record lost silently: the counters found and the `dropped` ones
    // are all the records made, each found at most once.
    static void expectAccounted(std::vector<long> found, long dropped)
    {
        std::sort(found.begin(), found.end());
        ASSERT_FALSE(found.empty());
        EXPECT_TRUE(std::adjacent_find(found.begin(), found.end()) == found.end()) << "a record written twice";
        EXPECT_EQ(found.back() + 1, static_cast<long>(found.size()) + dropped);
    }

    void stop()
    {
        m_collector->signal(SIGTERM);
        const int exit = m_collector->wait();
        EXPECT_TRUE(WIFEXITED(exit) && WEXITSTATUS(exit) == 0) << "wait status " << exit;
    }

    std::string m_dir, m_out, m_logDir;
    std::string m_root;      // where the collector's file system is seen from here
    std::vector<int> m_held;  // removed log files, still readable
    pid_t m_inner = -1;       // a collector started by a script, until it has stopped
    std::unique_ptr<Collector> m_collector;
};

TEST_F(FaultRun, FullFileSystemDropsWholeRecordsUntilSpaceIsFreed)
{
    // A tmpfs of 16 pages that only the collector sees (an unprivileged
    // user gets one in a user namespace of its own). The shell that starts
    // the collector outlives it, so that the files can be read afterwards.
    if (EMULATOR != nullptr)
        GTEST_SKIP() << "programs of this build run under " << EMULATOR << ", which cannot start a script";
    const std::string mnt = m_dir + "/mnt";
    ASSERT_EQ(0, mkdir(mnt.c_str(), 0755));
    const std::string unshare = (geteuid() == 0 ? "unshare -m" : "unshare -r -m") + std::string(" --propagation private");
    if (!shell(unshare + " mount -t tmpfs -o size=64k wq5probe " + mnt))
        GTEST_SKIP() << "'" << unshare << "' cannot mount a tmpfs here: no private mount namespace allowed";
    m_logDir = mnt + "/log";
    start(writeScript("exec " + unshare + " sh -c 'mount -t tmpfs -o size=64k wq5full " + mnt + " && mkdir " +
                      m_logDir + " && echo $$ >" + m_out + "/pid && { " + collectorBinary() + " & echo $! >" + m_out +
                      "/cpid; wait $!; echo $? >" + m_out + "/exit; exec sleep 600; }'"));
    const auto line = [&](const std::string& name) {
        const std::string text = readFile(m_out + "/" + name);
        return text.substr(0, text.find('\n'));
    };
    waitUntil(m_out, [&] { return !line("cpid").empty(); }, "collector started");
    m_root = "/proc/" + line("pid") + "/root";
    m_inner = std::stoi(line("cpid"));

    waitUntil(logPath(), [&] { return logCounters(false).size() >= 20; }, "20 records written");
    const int fill = open((m_root + mnt + "/filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_GE(fill, 0) << "the tmpfs cannot be reached through " << m_root;
    const std::string block(4096, 'x');
    while (write(fill, block.data(), block.size()) > 0) {
    }
    EXPECT_EQ(ENOSPC, errno);
    close(fill);
    waitUntil(m_out, [&] { return traced(FAILED_WRITE) >= 50; }, "50 records dropped");
    ASSERT_EQ(0, unlink((m_root + mnt + "/filler").c_str()));
    waitUntil(m_out, [&] { return traced(RESUMED) == 1; }, "writing resumed");
    const size_t resumedAt = logCounters(false).size();
    waitUntil(logPath(), [&] { return logCounters(false).size() >= resumedAt + 20; }, "20 records after");

    ASSERT_EQ(0, kill(m_inner, SIGTERM));
    waitUntil(m_out, [&] { return !line("exit").empty(); }, "collector stopped");
    m_inner = -1;
    EXPECT_EQ("0", line("exit"));
    const int dropped = traced(FAILED_WRITE);
    RecordProperty("dropped", dropped);
    EXPECT_EQ(dropped, traced(FAILED_WRITE + std::to_string(ENOSPC)));
    EXPECT_EQ(1, runsOfFailures());
    expectAccounted(logCounters(true), dropped);
}

TEST_F(FaultRun, RemovedLogDirectoryLosesOnlyTheRecordsUntilItIsBack)
{
    ASSERT_EQ(0, mkdir(m_logDir.c_str(), 0755));
    start(collectorBinary());
    for (int run = 1; run <= 2; ++run) {
        waitUntil(m_logDir, [&] { return logCounters(false).size() >= 10; }, "10 records written");
        // Moved away first, so that no new file can appear in it; the file
        // stays readable through the descriptor held here.
        const std::vector<std::string> files = logFiles();
        ASSERT_EQ(1u, files.size());
        m_held.push_back(open((m_logDir + "/" + files[0]).c_str(), O_RDONLY | O_CLOEXEC));
        const std::string gone = m_dir + "/gone";
        ASSERT_EQ(0, rename(m_logDir.c_str(), gone.c_str()));
        ASSERT_EQ(0, unlink((gone + "/" + files[0]).c_str()));
        ASSERT_EQ(0, rmdir(gone.c_str()));
        const int before = traced(FAILED_OPEN);
        waitUntil(m_out, [&] { return traced(FAILED_OPEN) >= before + 5; }, "5 records dropped");
        ASSERT_EQ(0, mkdir(m_logDir.c_str(), 0755));
        waitUntil(m_out, [&] { return traced(RESUMED) == run; }, "writing resumed");
    }
    waitUntil(m_logDir, [&] { return logCounters(false).size() >= 10; }, "10 records written");
    stop();

    std::vector<long> found = logCounters(true);
    for (int fd : m_held)
        for (long n : counters(readFile("/proc/self/fd/" + std::to_string(fd)), true))
            found.push_back(n);
    EXPECT_EQ(0, traced(FAILED_WRITE));
    EXPECT_EQ(2, runsOfFailures());
    EXPECT_EQ(2, traced("> cannot be opened")) << "one open error per run of failures";
    expectAccounted(found, traced(FAILED_OPEN));
}

TEST_F(FaultRun, UnwritableDirectoryWhenTheNextNumberIsDue)
{
    if (EMULATOR != nullptr)
        GTEST_SKIP() << "programs of this build run under " << EMULATOR << ", which cannot start a script";
    // Permissions bind only an unprivileged collector.
    if (geteuid() != 0)
        GTEST_SKIP() << "starting the collector as user nobody needs root";
    const std::string nobody = "setpriv --reuid=65534 --regid=65534 --clear-groups ";
    if (!shell(nobody + "test -x " + collectorBinary()))
        GTEST_SKIP() << "user nobody cannot run " << collectorBinary() << " (no setpriv, or the path is closed)";
    const auto today = [] {
        const time_t now = time(nullptr);
        char date[16];
        strftime(date, sizeof date, "%Y%m%d", gmtime(&now));
        return std::string(date);
    };
    const std::string date = today();
    // Today's file is over the 1 MB limit: the first record needs number 1.
    const std::string full = m_logDir + "/" + date + ".wq5";
    ASSERT_EQ(0, chmod(m_dir.c_str(), 0755));
    ASSERT_EQ(0, mkdir(m_logDir.c_str(), 0755));
    writeFile(full, "");
    ASSERT_EQ(0, truncate(full.c_str(), 1048577));
    for (const std::string& path : {m_logDir, m_out, full})
        ASSERT_EQ(0, chown(path.c_str(), NOBODY, NOBODY)) << path;
    ASSERT_EQ(0, chmod(m_logDir.c_str(), 0555));
    start(writeScript("exec " + nobody + collectorBinary()), "1");

    waitUntil(m_out, [&] { return traced(FAILED_OPEN) >= 5; }, "5 records dropped");
    ASSERT_EQ(0, chmod(m_logDir.c_str(), 0755));
    waitUntil(m_logDir, [&] { return logCounters(false).size() >= 10; }, "10 records written");
    stop();
    if (today() != date)
        GTEST_SKIP() << "the day changed while the test ran";

    const std::string next = m_logDir + "/" + date + ".1.wq5";
    EXPECT_EQ(std::vector<std::string>({date + ".1.wq5", date + ".wq5"}), logFiles());
    EXPECT_EQ(std::string(1048577, '\0'), readFile(full));
    EXPECT_EQ(1, traced("Error: Data file <" + next + "> cannot be opened"));
    EXPECT_EQ(1, runsOfFailures());
    expectAccounted(counters(readFile(next), true), traced(FAILED_OPEN));
}

}  // namespace
