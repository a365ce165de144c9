// The filter manager against our collection library, in process: which
// filters exist, registration and its loss, and tables given back.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "libzub1api/zub1sim.h"
#include "mfmgr.h"
#include "platform/moq.h"
#include "support/process.h"
#include "support/trace_capture.h"

namespace {

const char* const kSwitches[] = {"WQ5_LOG_HTTP",       "WQ5_LOG_HTTPOBJ",    "WQ5_LOG_HTTPS",
                                 "WQ5_LOG_MS_VIDEO",   "WQ5_LOG_MS_AUDIO",   "WQ5_LOG_REAL_VIDEO",
                                 "WQ5_LOG_REAL_AUDIO", "WQ5_LOG_QUICKTIME"};

class FilterManagerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_dir = wq5test::makeTempDir();
        for (const char* name : kSwitches)
            unsetenv(name);
        for (const char* name : {"ZUB1_REPLAY", "ZUB1_STATUS_FILE", "ZUB1_REGISTER_FAILURES", "ZUB1_THREADS"})
            unsetenv(name);
        setenv("WQ5_LOG_DIR", (m_dir + "/log").c_str(), 1);
        setenv("ZUB1_START_DELAY_MS", "0", 1);
        ASSERT_EQ(ZUB1SIM_Reset(), 0);
    }

    void TearDown() override
    {
        FilterManager::destroyInstance();
        wq5test::removeTree(m_dir);
    }

    static ZUB1SIM_STATS stats()
    {
        ZUB1SIM_STATS s;
        ZUB1SIM_GetStats(&s);
        return s;
    }

    std::string m_dir;
};

struct Defined {
    int proto;
    int serv;
    void (*callback)(void*);
};

struct SwitchCase {
    const char* title;
    std::vector<const char*> on;
    std::vector<Defined> filters;  // in definition order
};

TEST_F(FilterManagerTest, OneFilterPerEnabledKind)
{
    const SwitchCase cases[] = {
        {"nothing on", {}, {}},
        {"objects alone need the HTTP filter", {"WQ5_LOG_HTTPOBJ"}, {{0, 80, gotHttpPage}}},
        {"pages and objects share one filter", {"WQ5_LOG_HTTP", "WQ5_LOG_HTTPOBJ"}, {{0, 80, gotHttpPage}}},
        {"HTTP and secure HTTP", {"WQ5_LOG_HTTP", "WQ5_LOG_HTTPS"}, {{0, 80, gotHttpPage}, {0, 443, gotHttpPage}}},
        {"MS audio and QuickTime", {"WQ5_LOG_QUICKTIME", "WQ5_LOG_MS_AUDIO"}, {{5, 0, gotAudio}, {3, 0, gotVideo}}},
        {"everything",
         {"WQ5_LOG_HTTP", "WQ5_LOG_HTTPOBJ", "WQ5_LOG_HTTPS", "WQ5_LOG_MS_VIDEO", "WQ5_LOG_MS_AUDIO",
          "WQ5_LOG_REAL_VIDEO", "WQ5_LOG_REAL_AUDIO", "WQ5_LOG_QUICKTIME"},
         {{0, 80, gotHttpPage},
          {0, 443, gotHttpPage},
          {1, 0, gotVideo},
          {5, 0, gotAudio},
          {2, 0, gotVideo},
          {6, 0, gotAudio},
          {3, 0, gotVideo}}},
    };
    for (const SwitchCase& c : cases) {
        SCOPED_TRACE(c.title);
        for (const char* name : kSwitches)
            unsetenv(name);
        for (const char* name : c.on)
            setenv(name, "Y", 1);

        FilterManager* manager = FilterManager::instance();
        EXPECT_FALSE(manager->isConnected());
        EXPECT_EQ(manager->connect(), 0);
        EXPECT_TRUE(manager->isConnected());

        ZUB1SIM_FILTER defined[16];
        const int n = ZUB1SIM_GetFilters(defined, 16);
        ASSERT_EQ(n, static_cast<int>(c.filters.size()));
        for (int i = 0; i < n; ++i) {
            EXPECT_EQ(defined[i].protocol, c.filters[i].proto) << "filter " << i;
            EXPECT_EQ(defined[i].service, c.filters[i].serv) << "filter " << i;
            EXPECT_EQ(defined[i].callback, c.filters[i].callback) << "filter " << i;
        }

        const uint64_t unregistrationsBefore = stats().unregistrations;
        FilterManager::destroyInstance();
        EXPECT_EQ(stats().unregistrations, unregistrationsBefore + 1);
        EXPECT_EQ(stats().filtersDefined, 0u);
    }
}

TEST_F(FilterManagerTest, RefusedRegistrationLeavesCollectorUnregistered)
{
    setenv("WQ5_LOG_HTTP", "Y", 1);
    setenv("ZUB1_REGISTER_FAILURES", "1", 1);
    TraceCapture trace(TRC_DETAIL);
    FilterManager* manager = FilterManager::instance();

    const int rc = manager->connect();
    EXPECT_NE(rc, 0);
    EXPECT_FALSE(manager->isConnected());
    EXPECT_EQ(trace.count("unable to connect.  rc = <" + std::to_string(rc) + ">"), 1);
    EXPECT_EQ(ZUB1SIM_GetFilters(nullptr, 0), 0);

    EXPECT_EQ(manager->connect(), 0);
    EXPECT_TRUE(manager->isConnected());
    EXPECT_EQ(trace.count("DefineFilter proto <0> serv <80> rc <0>"), 1);
}

TEST_F(FilterManagerTest, DisconnectWhenNotRegisteredCallsNothing)
{
    FilterManager* manager = FilterManager::instance();
    EXPECT_EQ(manager->disconnect(), 0);
    EXPECT_FALSE(manager->isConnected());
    EXPECT_EQ(stats().unregistrations, 0u);
}

TEST_F(FilterManagerTest, FirstEntryWithoutRegistrationDisconnects)
{
    setenv("WQ5_LOG_HTTP", "Y", 1);
    TraceCapture trace(TRC_DETAIL);
    FilterManager* manager = FilterManager::instance();
    ASSERT_EQ(manager->connect(), 0);

    ASSERT_EQ(ZUB1SIM_DeliverLine("{\"filter\":[0,80],\"entries\":[{\"registeredFlag\":0,\"rdType\":\"HTTP\"},"
                                  "{\"registeredFlag\":1,\"rdType\":\"HTTP\",\"httpEntryType\":1}]}"),
              0);
    ASSERT_EQ(ZUB1SIM_WaitIdle(60000), 0);

    EXPECT_FALSE(manager->isConnected());
    const ZUB1SIM_STATS s = stats();
    EXPECT_EQ(s.unregistrations, 1u);
    EXPECT_EQ(s.delivered, 1u);
    EXPECT_EQ(s.freed, 1u);
    EXPECT_EQ(s.badFrees, 0u);

    // The table's address is traced when it arrives and after it is freed.
    const std::vector<std::string> lines = trace.lines();
    std::string handled, freed;
    for (const std::string& line : lines) {
        const size_t h = line.find("Handling http callback answer area 0x");
        const size_t f = line.find("Freeing  http callback answer area 0x");
        if (h != std::string::npos)
            handled = line.substr(h + 37);
        if (f != std::string::npos)
            freed = line.substr(f + 37);
    }
    EXPECT_FALSE(handled.empty());
    EXPECT_EQ(handled, freed);

    // The next registration defines the filters again.
    EXPECT_EQ(manager->connect(), 0);
    EXPECT_EQ(ZUB1SIM_GetFilters(nullptr, 0), 1);
}

TEST_F(FilterManagerTest, EveryTableGivenBackOnceUnderConcurrentDelivery)
{
    for (const char* name : kSwitches)
        setenv(name, "Y", 1);
    setenv("ZUB1_THREADS", "4", 1);
    FilterManager* manager = FilterManager::instance();
    ASSERT_EQ(manager->connect(), 0);

    // Tables that write nothing (types not written, no entries, negative
    // counts) on every filter, delivered on four threads at once.
    const char* const lines[] = {
        "{\"filter\":[0,80],\"entries\":[{\"rdType\":\"HTTP\",\"httpEntryType\":3},{\"rdType\":\"NONE\"}]}",
        "{\"filter\":[0,443],\"entries\":[]}",
        "{\"filter\":[1,0],\"entries\":[{\"rdType\":\"TCP \"}],\"entryCount\":-1}",
        "{\"filter\":[5,0],\"entries\":[{\"rdType\":\"UDP \"}],\"entryCount\":0}",
        "{\"filter\":[2,0],\"entries\":[{\"rdType\":\"NONE\"},{\"rdType\":\"PKTS\"}]}",
        "{\"filter\":[6,0],\"entries\":[{\"rdType\":\"STAT\"}]}",
        "{\"filter\":[3,0],\"entries\":[{\"rdType\":\"CTXT\"}]}",
    };
    const int rounds = 60;
    for (int r = 0; r < rounds; ++r)
        for (const char* line : lines)
            ASSERT_EQ(ZUB1SIM_DeliverLine(line), 0);
    ASSERT_EQ(ZUB1SIM_WaitIdle(120000), 0);

    const ZUB1SIM_STATS s = stats();
    const uint64_t total = rounds * (sizeof(lines) / sizeof(lines[0]));
    EXPECT_EQ(s.delivered, total);
    EXPECT_EQ(s.freed, total);
    EXPECT_EQ(s.unmatched, 0u);
    EXPECT_EQ(s.badFrees, 0u);
    EXPECT_TRUE(manager->isConnected());
}

}  // namespace
