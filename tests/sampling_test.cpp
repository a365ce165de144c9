// Sampling: from the configured percentage to factor and mode, the fixed
// pattern a sampler keeps, and the three samplers counting apart.
#include <gtest/gtest.h>

#include <set>
#include <string>

#include "support/handler_fixture.h"
#include "support/trace_capture.h"

namespace {

using wq5test::HandlerFixture;
typedef DataHandlerTestAccess Access;

// The next `n` decisions of `sampler` (K passes, - dropped); logSamplesActive
// must repeat each one.
std::string pattern(SampleControl& sampler, size_t n)
{
    std::string out;
    for (size_t i = 0; i < n; ++i) {
        const bool passed = sampler.checkSampling();
        EXPECT_EQ(passed, sampler.logSamplesActive()) << "after record " << i + 1;
        out += passed ? 'K' : '-';
    }
    return out;
}

std::string times(const std::string& piece, int n) { return n == 0 ? "" : piece + times(piece, n - 1); }

TEST(CalculateLogPercent, MapsEveryThresholdToFactorAndModeInOneTraceLine)
{
    // Every threshold and the value just below it; 0 stands for 100 (see the patterns) and is not traced.
    const struct { int percent, factor; bool skip; } rows[] = {
        {100, 100, true}, {99, 100, true}, {98, 50, true}, {97, 34, true}, {96, 25, true}, {95, 20, true},
        {94, 10, true},   {90, 10, true},  {89, 7, true},  {85, 7, true},  {84, 5, true},  {80, 5, true},
        {79, 4, true},    {70, 4, true},   {69, 3, true},  {60, 3, true},  {59, 2, true},  {45, 2, true},
        {44, 3, false},   {30, 3, false},  {29, 4, false}, {25, 4, false}, {24, 5, false}, {20, 5, false},
        {19, 6, false},   {15, 6, false},  {14, 10, false}, {10, 10, false}, {9, 14, false}, {7, 14, false},
        {6, 16, false},   {5, 20, false},  {4, 25, false}, {3, 33, false}, {2, 50, false}, {1, 100, false},
        {0, 0, false}};
    for (const auto& r : rows) {
        TraceCapture trace(TRC_DETAIL);
        HandlerFixture fixture(wq5test::Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", std::to_string(r.percent)}});
        const std::string expected = "log pct = " + std::to_string(r.percent) + " factor = " +
                                     std::to_string(r.factor) + " skipMode = " + (r.skip ? "true" : "false");
        std::set<std::string> traced;  // of every handler built: the manager's own and the fixture's
        for (const std::string& line : trace.lines())
            if (line.find("log pct = ") != std::string::npos)
                traced.insert(line.substr(line.find("log pct = "), line.size() - line.find("log pct = ") - 1));
        EXPECT_EQ(r.percent == 0 ? std::set<std::string>() : std::set<std::string>{expected}, traced);
    }
}

TEST(SampleControl, KeepsTheFixedPatternOfEachConfiguredPercentage)
{
    const std::string K99 = times("K", 99), K33 = times("K", 33);
    const struct { const char* percent; std::string pattern; } rows[] = {
        {"100", times("K", 250)}, {"99", times(K99 + "-", 2) + "K"}, {"97", times(K33 + "-", 3) + "K"},
        {"90", "KKKKKKKKK-KKKKKKKKK-K"}, {"75", "KKK-KKK-KKK-K"}, {"70", "KKK-KKK-KKK-K"}, {"60", "KK-KK-KK-K"},
        {"50", "K-K-K-K"}, {"45", "K-K-K-K"}, {"44", "K--K--K--K"}, {"37", "K--K--K--K"}, {"30", "K--K--K--K"},
        {"25", "K---K---K---K"}, {"15", "K-----K-----K"}, {"7", times("K" + times("-", 13), 3) + "K"},
        {"3", times("K" + times("-", 32), 3) + "K"}, {"1", times("K" + times("-", 99), 3) + "K"},
        {"0", times("K", 250)}};
    for (const auto& r : rows) {
        HandlerFixture fixture(wq5test::Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", r.percent}});
        SampleControl& sampler = Access::sampler(fixture.handler(), 1);
        EXPECT_TRUE(sampler.logSamplesActive()) << r.percent << " %, before the first record";
        EXPECT_EQ(r.pattern, pattern(sampler, r.pattern.size())) << r.percent << " %";
    }
}

TEST(SampleControl, TheThreeSamplersCountApart)
{
    HandlerFixture fixture(wq5test::Settings{{"WQ5_LOG_SAMPLE_PERCENTAGE", "60"}});  // K K -
    SampleControl& http = Access::sampler(fixture.handler(), 0);
    SampleControl& video = Access::sampler(fixture.handler(), 1);
    SampleControl& audio = Access::sampler(fixture.handler(), 2);
    EXPECT_EQ("KK-K", pattern(video, 4));
    EXPECT_EQ("KK", pattern(audio, 2));
    EXPECT_EQ("KK-KK", pattern(http, 5));
    EXPECT_EQ("K-", pattern(video, 2));
    EXPECT_EQ("-K", pattern(audio, 2));
    EXPECT_EQ("-", pattern(http, 1));
}

}  // namespace
