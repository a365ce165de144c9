// Settings read from the environment: defaults, parsing rules and the one
// correction the collector reports.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

#include "mcfg.h"
#include "platform/moq.h"
#include "support/trace_capture.h"

namespace {

const char* const kAllSettings[] = {
    "WQ5_COLLECTOR_ID", "WQ5_LOG_DIR",       "WQ5_LOG_KEEPDAYS",   "WQ5_LOG_SAMPLE_PERCENTAGE",
    "WQ5_LOG_MAX_SIZE_MB", "WQ5_LOG_HTTP",   "WQ5_LOG_HTTPOBJ",    "WQ5_LOG_HTTPS",
    "WQ5_LOG_MS_VIDEO", "WQ5_LOG_MS_AUDIO",  "WQ5_LOG_REAL_VIDEO", "WQ5_LOG_REAL_AUDIO",
    "WQ5_LOG_QUICKTIME", "WQ5_FIELD_DELIMITER", "WQ5_SUB_CHAR",
};

std::string hostName()
{
    char host[256] = {0};
    gethostname(host, sizeof(host) - 1);
    return host;
}

// "<host>" in `name` stands for this machine's host name.
struct Expected {
    std::string name = "<host>";
    std::string logDir = "log";
    long keepDays = 7;
    int percent = 100;
    long maxSize = 0;
    // http, httpobj, https, ms video, ms audio, real video, real audio,
    // quicktime: 'Y' or 'N' each.
    std::string switches = "NNNNNNNN";
    char delimiter = '^';
    char subChar = '_';
    std::string message;  // the one error line expected, if any
};

struct Case {
    const char* title;
    std::vector<std::pair<const char*, const char*>> env;
    Expected expected;
};

Expected with(void (*change)(Expected&))
{
    Expected e;
    change(e);
    return e;
}

const Case kCases[] = {
    {"nothing set", {}, Expected()},
    {"empty collector id takes the host name", {{"WQ5_COLLECTOR_ID", ""}}, Expected()},
    {"collector id", {{"WQ5_COLLECTOR_ID", "probe-7"}}, with([](Expected& e) { e.name = "probe-7"; })},
    {"log dir as is", {{"WQ5_LOG_DIR", "/var/x y"}}, with([](Expected& e) { e.logDir = "/var/x y"; })},
    {"empty log dir takes the default", {{"WQ5_LOG_DIR", ""}}, Expected()},
    {"percent above 100", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "150"}},
     with([](Expected& e) { e.message = "WQ5_LOG_SAMPLE_PERCENTAGE value of 150 corrected to 100"; })},
    {"percent below 0", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "-5"}},
     with([](Expected& e) { e.message = "WQ5_LOG_SAMPLE_PERCENTAGE value of -5 corrected to 100"; })},
    {"percent 0 stays", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "0"}}, with([](Expected& e) { e.percent = 0; })},
    {"percent not a number", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "abc"}}, with([](Expected& e) { e.percent = 0; })},
    {"percent with a sign after it", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "50%"}},
     with([](Expected& e) { e.percent = 50; })},
    {"percent 100 stays", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "100"}}, Expected()},
    {"keep days negative", {{"WQ5_LOG_KEEPDAYS", "-1"}}, with([](Expected& e) { e.keepDays = -1; })},
    {"keep days not a number", {{"WQ5_LOG_KEEPDAYS", "x3"}}, with([](Expected& e) { e.keepDays = 0; })},
    {"keep days too large for an int: held, not wrapped", {{"WQ5_LOG_KEEPDAYS", "4294967297"}},
     with([](Expected& e) { e.keepDays = 2147483647; })},
    {"percent too large for an int", {{"WQ5_LOG_SAMPLE_PERCENTAGE", "99999999999"}},
     with([](Expected& e) { e.message = "WQ5_LOG_SAMPLE_PERCENTAGE value of 2147483647 corrected to 100"; })},
    {"max size leading digits", {{"WQ5_LOG_MAX_SIZE_MB", "12MB"}}, with([](Expected& e) { e.maxSize = 12; })},
    {"switches: y, Yes, Y count; no, N, 1, true, on do not",
     {{"WQ5_LOG_HTTP", "y"},
      {"WQ5_LOG_HTTPOBJ", "no"},
      {"WQ5_LOG_HTTPS", "Yes"},
      {"WQ5_LOG_MS_VIDEO", "1"},
      {"WQ5_LOG_MS_AUDIO", "Y"},
      {"WQ5_LOG_REAL_VIDEO", "true"},
      {"WQ5_LOG_REAL_AUDIO", "on"},
      {"WQ5_LOG_QUICKTIME", "N"}},
     with([](Expected& e) { e.switches = "YNYNYNNN"; })},
    {"every switch on", {{"WQ5_LOG_HTTP", "Y"}, {"WQ5_LOG_HTTPOBJ", "Y"}, {"WQ5_LOG_HTTPS", "Y"},
                         {"WQ5_LOG_MS_VIDEO", "Y"}, {"WQ5_LOG_MS_AUDIO", "Y"}, {"WQ5_LOG_REAL_VIDEO", "Y"},
                         {"WQ5_LOG_REAL_AUDIO", "Y"}, {"WQ5_LOG_QUICKTIME", "Y"}},
     with([](Expected& e) { e.switches = "YYYYYYYY"; })},
    {"delimiter and sub char: first character only", {{"WQ5_FIELD_DELIMITER", "|;"}, {"WQ5_SUB_CHAR", "-+"}},
     with([](Expected& e) {
         e.delimiter = '|';
         e.subChar = '-';
     })},
    {"empty delimiter and sub char take their defaults", {{"WQ5_FIELD_DELIMITER", ""}, {"WQ5_SUB_CHAR", ""}},
     Expected()},
};

std::string switchesOf(const Config& c)
{
    const bool on[] = {c.logHttp(),    c.logHttpObj(),   c.logHttpSecure(), c.logMSVideo(),
                       c.logMSAudio(), c.logRealVideo(), c.logRealAudio(),  c.logQuickTime()};
    std::string s;
    for (bool b : on)
        s += b ? 'Y' : 'N';
    return s;
}

TEST(ConfigTest, SettingsTable)
{
    for (const Case& c : kCases) {
        SCOPED_TRACE(c.title);
        for (const char* name : kAllSettings)
            unsetenv(name);
        for (const auto& kv : c.env)
            setenv(kv.first, kv.second, 1);

        TraceCapture trace(TRC_ERROR | TRC_DETAIL);
        Config config;
        const Expected& e = c.expected;

        EXPECT_EQ(config.getName(), e.name == "<host>" ? hostName() : e.name);
        EXPECT_EQ(config.getLogDir(), e.logDir);
        EXPECT_EQ(config.getKeepDays(), e.keepDays);
        EXPECT_EQ(config.getLogPercent(), e.percent);
        EXPECT_EQ(config.getLogMaxSize(), e.maxSize);
        EXPECT_EQ(switchesOf(config), e.switches);
        EXPECT_EQ(config.getDelimiter(), e.delimiter);
        EXPECT_EQ(config.getSubChar(), e.subChar);
        EXPECT_EQ(config.getVersion(), "v121");
        EXPECT_EQ(config.getLogSuffix(), "wq5");

        const std::string detail = std::string("delimiter <") + e.delimiter + "> sub char <" + e.subChar + ">";
        EXPECT_EQ(trace.count(detail), 1);
        if (e.message.empty())
            EXPECT_EQ(trace.count("corrected to 100"), 0);
        else
            EXPECT_EQ(trace.count(e.message), 1);
    }
    for (const char* name : kAllSettings)
        unsetenv(name);
}

TEST(ConfigTest, FlowEventsOnlyWithFlowClass)
{
    {
        TraceCapture trace(TRC_FLOW);
        Config config;
        const std::vector<std::string> lines = trace.lines();
        ASSERT_EQ(lines.size(), 2u);
        EXPECT_NE(lines[0].find("> Config::Config"), std::string::npos) << lines[0];
        EXPECT_NE(lines[1].find("< Config::Config"), std::string::npos) << lines[1];
    }
    {
        TraceCapture trace(TRC_ERROR | TRC_INFO);
        Config config;
        EXPECT_TRUE(trace.lines().empty());
    }
}

}  // namespace
