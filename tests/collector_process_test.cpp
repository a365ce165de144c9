// The real collector process against our collection library: start-up,
// registration and its renewal, and the orderly stop on SIGTERM.
#include <gtest/gtest.h>

#include <csignal>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "support/process.h"

using namespace wq5test;

namespace {

class CollectorProcessTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_dir = makeTempDir();
        ASSERT_FALSE(m_dir.empty());
        m_trace = m_dir + "/trace.log";
        m_status = m_dir + "/status.json";
    }
    void TearDown() override { removeTree(m_dir); }

    // Environment of a collector with the HTTP switch on, tracing every
    // class into the test's own file, with nothing to replay.
    std::map<std::string, std::string> baseEnv(const std::string& mask = "all") const
    {
        return {
            {"MOQ_TRACE", mask},
            {"MOQ_TRACE_FILE", m_trace},
            {"WQ5_LOG_DIR", m_dir + "/log"},
            {"WQ5_LOG_HTTP", "Y"},
            {"WQ5_WORK_PATH", "\x01unset"},
            {"ZUB1_REPLAY", "\x01unset"},
            {"ZUB1_STATUS_FILE", m_status},
            {"ZUB1_START_DELAY_MS", "\x01unset"},
            {"ZUB1_REGISTER_FAILURES", "\x01unset"},
        };
    }

    bool waitForTrace(const std::string& text, int times = 1)
    {
        return waitFor(m_dir, [&] { return countIn(m_trace, text) >= times; });
    }

    std::vector<std::string> traceLines() const
    {
        std::vector<std::string> lines;
        std::istringstream in(readFile(m_trace));
        for (std::string line; std::getline(in, line);)
            lines.push_back(line);
        return lines;
    }

    // Index of the first trace line containing `text`, or -1.
    int lineOf(const std::string& text) const
    {
        const std::vector<std::string> lines = traceLines();
        for (size_t i = 0; i < lines.size(); ++i)
            if (lines[i].find(text) != std::string::npos)
                return static_cast<int>(i);
        return -1;
    }

    // Stops the collector with SIGTERM and expects an orderly exit 0.
    void stopAndExpectCleanExit(Collector& collector)
    {
        collector.signal(SIGTERM);
        const int status = collector.wait();
        ASSERT_NE(status, -1) << "collector did not stop";
        ASSERT_TRUE(WIFEXITED(status)) << "collector ended by signal " << WTERMSIG(status);
        EXPECT_EQ(WEXITSTATUS(status), 0);
    }

    std::string m_dir;
    std::string m_trace;
    std::string m_status;
};

TEST_F(CollectorProcessTest, StopsInOrderWhileRegistered)
{
    Collector collector(collectorBinary(), baseEnv());
    ASSERT_TRUE(collector.started());
    ASSERT_TRUE(waitForTrace("connection successful id = <"));
    stopAndExpectCleanExit(collector);

    // The lifecycle in order. The control thread starts registering while
    // the main thread traces its start-up, so the two run as separate chains.
    const std::vector<std::vector<const char*>> chains = {
        {"> pvomain", "Starting WQ5 Collector...", "WQ5 Collector starts up successfully.", "WQ5 Collector stopped.",
         "< pvomain rc=0"},
        {"Starting WQ5 Collector...", "connecting...", "DefineFilter proto <0> serv <80> rc <0>",
         "connection successful id = <", "> pvoquit", "Shutting down WQ5 Collector...", "< pvoquit",
         "disconnecting id = <", "unregistered rc <0>", "WQ5 Collector stopped."},
    };
    for (const std::vector<const char*>& chain : chains) {
        int previous = -1;
        for (const char* text : chain) {
            const int at = lineOf(text);
            EXPECT_GT(at, previous) << "\"" << text << "\" missing or out of order\n" << readFile(m_trace);
            previous = at;
        }
    }
    // Only the HTTP switch is on: one filter.
    EXPECT_EQ(countIn(m_trace, "DefineFilter proto <"), 1);
}

TEST_F(CollectorProcessTest, StopsBeforeAnyRegistration)
{
    std::map<std::string, std::string> env = baseEnv();
    env["ZUB1_REGISTER_FAILURES"] = "1000000";
    Collector collector(collectorBinary(), env);
    ASSERT_TRUE(collector.started());
    ASSERT_TRUE(waitForTrace("unable to connect.  rc = <"));
    stopAndExpectCleanExit(collector);
    EXPECT_EQ(countIn(m_trace, "WQ5 Collector stopped."), 1);
    // Nothing was registered, so nothing is unregistered.
    EXPECT_EQ(countIn(m_trace, "unregistered rc"), 0);
    EXPECT_EQ(countIn(m_trace, "DefineFilter"), 0);
}

TEST_F(CollectorProcessTest, RefusedRegistrationIsRetried)
{
    std::map<std::string, std::string> env = baseEnv();
    env["ZUB1_REGISTER_FAILURES"] = "1";
    Collector collector(collectorBinary(), env);
    ASSERT_TRUE(collector.started());
    // The control loop tries again at its next pass, 5 seconds later.
    ASSERT_TRUE(waitForTrace("connection successful id = <"));
    EXPECT_EQ(countIn(m_trace, "unable to connect.  rc = <"), 1);
    EXPECT_LT(lineOf("unable to connect."), lineOf("connection successful"));
    stopAndExpectCleanExit(collector);
}

TEST_F(CollectorProcessTest, LostRegistrationIsRenewedAndEveryTableGivenBack)
{
    // The first table says the registration is gone: the collector
    // disconnects, registers again at its next pass, and the library
    // delivers the rest afterwards.
    const std::string script = m_dir + "/script.jsonl";
    writeFile(script,
              "{\"filter\":[0,80],\"entries\":[{\"registeredFlag\":0,\"rdType\":\"HTTP\"},{\"rdType\":\"HTTP\"}]}\n"
              "{\"filter\":[0,80],\"entries\":[{\"rdType\":\"HTTP\",\"httpEntryType\":3}]}\n"
              "{\"filter\":[0,80],\"entries\":[]}\n");
    std::map<std::string, std::string> env = baseEnv();
    env["ZUB1_REPLAY"] = script;
    // One library thread: the tables after the first wait until it has
    // dropped the registration, and then for the next one.
    env["ZUB1_THREADS"] = "1";
    Collector collector(collectorBinary(), env);
    ASSERT_TRUE(collector.started());
    ASSERT_TRUE(waitFor(m_dir, [&] { return !readFile(m_status).empty(); }));
    stopAndExpectCleanExit(collector);

    EXPECT_EQ(countIn(m_trace, "connection successful id = <"), 2);
    EXPECT_EQ(countIn(m_trace, "unregistered rc <0>"), 2);  // the drop, then the stop
    const std::string status = readFile(m_status);
    EXPECT_NE(status.find("\"delivered\":3"), std::string::npos) << status;
    EXPECT_NE(status.find("\"freed\":3"), std::string::npos) << status;
    EXPECT_NE(status.find("\"badFrees\":0"), std::string::npos) << status;
}

TEST_F(CollectorProcessTest, OtherSignalsKeepTheirDefaultAction)
{
    for (int sig : {SIGINT, SIGHUP}) {
        SCOPED_TRACE(sig);
        writeFile(m_trace, "");
        Collector collector(collectorBinary(), baseEnv());
        ASSERT_TRUE(collector.started());
        ASSERT_TRUE(waitForTrace("connection successful id = <"));
        collector.signal(sig);
        const int status = collector.wait();
        ASSERT_TRUE(WIFSIGNALED(status));
        EXPECT_EQ(WTERMSIG(status), sig);
        EXPECT_EQ(countIn(m_trace, "Shutting down WQ5 Collector..."), 0);
    }
}

TEST_F(CollectorProcessTest, WithoutFlowClassNoLifecycleLines)
{
    Collector collector(collectorBinary(), baseEnv("detail"));
    ASSERT_TRUE(collector.started());
    ASSERT_TRUE(waitForTrace("connection successful id = <"));
    stopAndExpectCleanExit(collector);
    for (const char* text : {"pvomain", "pvoquit", "Starting WQ5 Collector...", "WQ5 Collector stopped.",
                             "Shutting down WQ5 Collector..."})
        EXPECT_EQ(countIn(m_trace, text), 0) << text;
    EXPECT_EQ(countIn(m_trace, "unregistered rc <0>"), 1);
}

TEST_F(CollectorProcessTest, UnusableWorkPathIsReportedAndIgnored)
{
    std::map<std::string, std::string> env = baseEnv();
    env["WQ5_WORK_PATH"] = m_dir + "/missing";
    Collector collector(collectorBinary(), env);
    ASSERT_TRUE(collector.started());
    ASSERT_TRUE(waitForTrace("connection successful id = <"));
    stopAndExpectCleanExit(collector);
    EXPECT_EQ(countIn(m_trace, "Error: cannot change to WQ5_WORK_PATH <" + m_dir + "/missing> errno <2>"), 1);
}

}  // namespace
