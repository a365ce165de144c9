// Sampling: from the configured percentage to factor and mode, the fixed
// pattern of each sampler, logSamplesActive, and the three samplers
// counting apart.
#include <gtest/gtest.h>

#include <string>

#include "support/handler_fixture.h"
#include "support/trace_capture.h"

namespace {

using wq5test::HandlerFixture;
using wq5test::Settings;
typedef DataHandlerTestAccess Access;

std::string times(const std::string& piece, int n)
{
    std::string out;
    for (int i = 0; i < n; ++i)
        out += piece;
    return out;
}

// The pattern a sampler produces over `n` records: K passes, - dropped.
std::string pattern(SampleControl& sampler, size_t n)
{
    std::string out;
    for (size_t i = 0; i < n; ++i)
        out += sampler.checkSampling() ? 'K' : '-';
    return out;
}

struct FactorCase {
    int percent;
    int factor;
    bool skipMode;
};

// Every threshold of the table and the value just below it.
const FactorCase FACTOR_CASES[] = {
    {100, 100, true}, {99, 100, true}, {98, 50, true}, {97, 34, true}, {96, 25, true}, {95, 20, true},
    {94, 10, true},   {90, 10, true},  {89, 7, true},  {85, 7, true},  {84, 5, true},  {80, 5, true},
    {79, 4, true},    {75, 4, true},   {70, 4, true},  {69, 3, true},  {60, 3, true},  {59, 2, true},
    {50, 2, true},    {45, 2, true},   {44, 3, false}, {30, 3, false}, {29, 4, false}, {25, 4, false},
    {24, 5, false},   {20, 5, false},  {19, 6, false}, {15, 6, false}, {14, 10, false}, {10, 10, false},
    {9, 14, false},   {7, 14, false},  {6, 16, false}, {5, 20, false}, {4, 25, false}, {3, 33, false},
    {2, 50, false},   {1, 100, false},
};

TEST(CalculateLogPercent, MapsEveryThresholdToFactorModeAndOneTraceLine)
{
    DataHandler handler(nullptr);
    for (const FactorCase& c : FACTOR_CASES) {
        SCOPED_TRACE("percent " + std::to_string(c.percent));
        TraceCapture trace(TRC_DETAIL);
        Access::setPercent(handler, c.percent);
        EXPECT_EQ(c.percent, Access::logPercent(handler));
        EXPECT_EQ(c.factor, Access::factor(handler));
        EXPECT_EQ(c.skipMode, Access::skipMode(handler));
        const std::string line = "log pct = " + std::to_string(c.percent) + " factor = " + std::to_string(c.factor) +
                                 " skipMode = " + (c.skipMode ? "true" : "false");
        EXPECT_EQ(1, trace.count(line));
        EXPECT_EQ(1u, trace.lines().size());
    }
}

TEST(CalculateLogPercent, ZeroBecomesOneHundredWithoutTrace)
{
    DataHandler handler(nullptr);
    TraceCapture trace(TRC_DETAIL);
    Access::setPercent(handler, 0);
    EXPECT_EQ(100, Access::logPercent(handler));
    EXPECT_TRUE(trace.lines().empty());
}

TEST(CalculateLogPercent, TraceLineNeedsTheDetailClass)
{
    DataHandler handler(nullptr);
    TraceCapture trace(TRC_ERROR | TRC_FLOW | TRC_INFO);
    Access::setPercent(handler, 25);
    EXPECT_EQ(0, trace.count("log pct = 25 factor = 4 skipMode = false"));
}

struct PatternCase {
    int percent;
    std::string pattern;  // over the first records offered to a fresh sampler
};

const std::string K99 = times("K", 99);
const std::string K33 = times("K", 33);

const PatternCase PATTERN_CASES[] = {
    {100, times("K", 250)},
    {99, times(K99 + "-", 2) + "K"},
    {97, times(K33 + "-", 3) + "K"},
    {90, "KKKKKKKKK-KKKKKKKKK-K"},
    {75, "KKK-KKK-KKK-K"},
    {70, "KKK-KKK-KKK-K"},
    {60, "KK-KK-KK-K"},
    {50, "K-K-K-K"},
    {45, "K-K-K-K"},
    {44, "K--K--K--K"},
    {37, "K--K--K--K"},
    {30, "K--K--K--K"},
    {25, "K---K---K---K"},
    {15, "K-----K-----K"},
    {7, times("K" + times("-", 13), 3) + "K"},
    {3, times("K" + times("-", 32), 3) + "K"},
    {1, times("K" + times("-", 99), 3) + "K"},
    {0, times("K", 250)},
};

TEST(SampleControl, KeepsTheFixedPatternOfEachPercentage)
{
    for (const PatternCase& c : PATTERN_CASES) {
        SCOPED_TRACE("percent " + std::to_string(c.percent));
        DataHandler handler(nullptr);
        Access::setPercent(handler, c.percent);
        SampleControl sampler(Access::logPercent(handler), Access::factor(handler), Access::skipMode(handler));
        EXPECT_EQ(c.pattern, pattern(sampler, c.pattern.size()));
    }
}

TEST(SampleControl, AtOneHundredPercentNothingIsCounted)
{
    SampleControl sampler(100, 100, true);
    for (int i = 0; i < 300; ++i) {
        ASSERT_TRUE(sampler.checkSampling()) << "record " << i + 1;
        ASSERT_TRUE(sampler.logSamplesActive()) << "record " << i + 1;
    }
    EXPECT_EQ(0, Access::count(sampler));
}

TEST(SampleControl, LogSamplesActiveFollowsTheLatestDecision)
{
    SampleControl sampler(25, 4, false);  // K - - - K
    EXPECT_TRUE(sampler.logSamplesActive()) << "before the first decision";
    const char* expected = "K---K";
    for (int i = 0; expected[i] != '\0'; ++i) {
        const bool passed = sampler.checkSampling();
        EXPECT_EQ(expected[i] == 'K', passed) << "record " << i + 1;
        EXPECT_EQ(passed, sampler.logSamplesActive()) << "after record " << i + 1;
        EXPECT_EQ(passed, sampler.logSamplesActive()) << "asked twice after record " << i + 1;
    }
}

TEST(SampleControl, GroupsRunOnAcrossTables)
{
    // The count belongs to the sampler, not to a table: a group that
    // starts in one table ends in the next.
    SampleControl sampler(60, 3, true);
    EXPECT_EQ("KK", pattern(sampler, 2));
    EXPECT_EQ("-KK", pattern(sampler, 3));
    EXPECT_EQ(2, Access::count(sampler));
}

TEST(DataHandlerSamplers, AreBuiltFromTheConfiguredPercentage)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "25"}});
    for (SampleControl* s : {Access::httpSampler(fixture.handler()), Access::videoSampler(fixture.handler()),
                             Access::audioSampler(fixture.handler())}) {
        ASSERT_NE(nullptr, s);
        EXPECT_EQ(25, Access::logPercent(*s));
        EXPECT_EQ(4, Access::factor(*s));
        EXPECT_FALSE(Access::skipMode(*s));
        EXPECT_EQ(0, Access::count(*s));
        EXPECT_TRUE(s->logSamplesActive());
    }
}

TEST(DataHandlerSamplers, ZeroPercentLetsEverythingPass)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "0"}});
    SampleControl* http = Access::httpSampler(fixture.handler());
    EXPECT_EQ(100, Access::logPercent(fixture.handler()));
    EXPECT_EQ(100, Access::logPercent(*http));
    EXPECT_EQ(times("K", 120), pattern(*http, 120));
}

TEST(DataHandlerSamplers, CountIndependently)
{
    HandlerFixture fixture(Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "60"}});  // K K -
    SampleControl* http = Access::httpSampler(fixture.handler());
    SampleControl* video = Access::videoSampler(fixture.handler());
    SampleControl* audio = Access::audioSampler(fixture.handler());
    EXPECT_EQ("KK-K", pattern(*video, 4));
    EXPECT_EQ("KK", pattern(*audio, 2));
    EXPECT_TRUE(http->logSamplesActive());
    EXPECT_EQ("KK-KK", pattern(*http, 5));
    EXPECT_EQ(1, Access::count(*video));
    EXPECT_EQ(2, Access::count(*audio));
    EXPECT_EQ(2, Access::count(*http));
    EXPECT_EQ("K", pattern(*video, 1));
    EXPECT_EQ("-", pattern(*audio, 1));
    EXPECT_EQ("-", pattern(*http, 1));
}

}  // namespace
