// libmoq: MOQ_TRACE values, the line format with its escapes, masks and sinks
// changed while tracing, and whole lines in a trace file shared by threads.
#include <fcntl.h>
#include <regex.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <thread>

#include "libmoq/moq_settings.h"
#include "support/process.h"
#include "support/trace_capture.h"

namespace {

TRC1_CUB s_unit = TRC1_UNIT_INIT("moq_test");
TRC1_EPB s_writer = TRC1_BLOCK_INIT(s_unit, "writeLines");
const int WRITER_LINES = 250;

std::string payload(int writer, int n)
{
    return "writer <" + std::to_string(writer) + "> line <" + std::to_string(n) + "> " + std::string(2000, 'x');
}

void writeLines(int writer)
{
    for (int n = 0; n < WRITER_LINES; ++n)
        if (trc1Mask(&s_writer) & TRC_INFO)
            TRC1_Printf(&s_writer, __LINE__, "%s", payload(writer, n).c_str());
}

// Started with MOQ_TEST_WRITERS=<n>, this program is a child that sends its standard error to
// MOQ_TEST_STDERR, traces its mask, runs n writers at once and exits before main.
const int s_writerMode = [] {
    if (getenv("MOQ_TEST_WRITERS") == nullptr)
        return 0;
    dup2(open(getenv("MOQ_TEST_STDERR"), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
    TRC1_Printf(&s_writer, __LINE__, "mask <%d>", trc1Mask(&s_writer));
    std::vector<std::thread> writers(atoi(getenv("MOQ_TEST_WRITERS")));
    for (size_t w = 0; w < writers.size(); ++w)
        writers[w] = std::thread(writeLines, w);
    for (std::thread& t : writers)
        t.join();
    _exit(0);
}();

// The text of a trace line after its prefix "<UTC time> [<thread>] moq_test:<line> <function>: ", or a note.
std::string textOf(const std::string& line)
{
    static regex_t prefix;
    static const int compiled = regcomp(&prefix,
        "^[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{6}Z \\[[0-9]+\\] moq_test:[0-9]+ [^ ]+: $",
        REG_EXTENDED | REG_NOSUB);
    const size_t cut = line.find(": ") + 2;
    const bool whole = compiled == 0 && cut != 1 && line.find('\n') == line.size() - 1 &&
                       regexec(&prefix, line.substr(0, cut).c_str(), 0, nullptr, 0) == 0;
    return whole ? line.substr(cut, line.size() - cut - 1) : "malformed line <" + line.substr(0, 100) + ">";
}

// Expects `lines` to be whole trace lines of, in any order, each payload of `writers` writers and each of `others`.
void expectWholeLines(const std::vector<std::string>& lines, int writers, std::vector<std::string> others)
{
    std::vector<std::string> texts;
    for (const std::string& line : lines)
        texts.push_back(textOf(line));
    for (int n = 0; n < writers * WRITER_LINES; ++n)
        others.push_back(payload(n / WRITER_LINES, n % WRITER_LINES));
    std::sort(texts.begin(), texts.end());
    std::sort(others.begin(), others.end());
    EXPECT_TRUE(texts == others) << "lines malformed, broken, lost or doubled: " << texts.size() << " lines, "
                                 << others.size() << " expected";
}

TEST(MoqSettings, MoqTraceValues)
{
    const struct { const char* text; int mask; } rows[] = {  // mask -1: refused
        {"0", 0}, {"208", 0xD0}, {"0x10", 0x10}, {"0XD1", 0xD1}, {"2147483647", 2147483647}, {"0x7fffffff", 2147483647},
        {"010", 10}, {"error", 0x80}, {"detail", 0x01}, {"error,flow,info", 0xD0}, {"all", 0xD1}, {"none", 0},
        {"none,flow", 0x40}, {" Info , ERROR ", 0x90}, {"", -1}, {"2147483648", -1}, {"0x80000000", -1}, {"-1", -1},
        {"99999999999999999999", -1}, {"+1", -1}, {"0x", -1}, {"0x1g", -1}, {"12abc", -1}, {"err", -1},
        {"error,", -1}, {",error", -1}, {"error,,flow", -1}, {"error flow", -1}, {"everything", -1}};
    for (const auto& r : rows) {
        int mask = -1;
        EXPECT_EQ(r.mask != -1, moq::parseMask(r.text, &mask)) << "<" << r.text << ">";
        EXPECT_EQ(r.mask, mask) << "<" << r.text << ">, untouched when refused";
    }
}

TEST(MoqFormat, TimeThreadUnitLineFunctionThenTheEscapedText)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "Fmt::run");
    const std::string exact(moq::MAX_MESSAGE, 'm'), over = exact + "0123456789";
    TraceCapture capture(TRC_FLOW);
    errno = EACCES;
    TRC1_Printf(&blk, 7, "value <%d> name <%s> ~", 42, "n");
    EXPECT_EQ(EACCES, errno) << "tracing keeps errno";
    for (int kind : {TRC1_ENTRY, TRC1_EXIT_VALUE, TRC1_EXIT, 9})
        TRC1_Event(&blk, 7, kind, -1);
    for (const std::string& text : {exact, over, std::string("a\nb\rc\td\\\x01\x1f\x7f caf\xc3\xa9")})
        TRC1_Printf(&blk, 7, "%s", text.c_str());
    TRC1_Printf(&blk, 7, "nul<%c>", 0);
    const std::vector<std::string> expected = {
        "value <42> name <n> ~", "> Fmt::run", "< Fmt::run rc=-1", "< Fmt::run", "? Fmt::run kind=9", exact,
        exact + " [cut at 65536 of 65546 bytes]", "a\\nb\\rc\\td\\\\\\x01\\x1f\\x7f caf\\xc3\\xa9", "nul<\\x00>"};
    const std::vector<std::string> lines = capture.lines();
    ASSERT_EQ(expected.size(), lines.size());
    for (size_t i = 0; i < lines.size(); ++i) {
        EXPECT_TRUE(textOf(lines[i]) == expected[i]) << lines[i].substr(0, 120);
        EXPECT_NE(std::string::npos, lines[i].find("] moq_test:7 Fmt::run: ")) << lines[i].substr(0, 120);
    }
}

TEST(MoqConcurrency, MasksAndSinksChangedWhileThreadsTrace)
{
    struct Sink {
        std::vector<std::string> lines;  // calls of a sink are serialised: no lock of its own
        static void take(void* s, const char* line, size_t n) { static_cast<Sink*>(s)->lines.emplace_back(line, n); }
    } sinks[2];
    const int old = MOQ_GetMask();
    MOQ_SetSink(&Sink::take, &sinks[0]);
    std::vector<std::thread> writers;
    for (int w = 0; w < 4; ++w)
        writers.emplace_back(writeLines, w);
    // The writers' block follows every mask at once, while they refresh it too.
    for (int i = 1; i <= 400; ++i) {
        MOQ_SetMask(TRC_INFO | i << 8);
        EXPECT_EQ(TRC_INFO | i << 8, trc1Mask(&s_writer));
        MOQ_SetSink(&Sink::take, &sinks[i % 2]);
    }
    for (std::thread& t : writers)
        t.join();
    MOQ_SetSink(nullptr, nullptr);
    MOQ_SetMask(old);
    sinks[0].lines.insert(sinks[0].lines.end(), sinks[1].lines.begin(), sinks[1].lines.end());
    expectWholeLines(sinks[0].lines, 4, {});
}

TEST(MoqConcurrency, ChildTracesWholeLinesOnceOrReportsBadSettingsAndTakesTheDefaults)
{
    const std::string dir = wq5test::makeTempDir(), file = dir + "/trace.log", err = dir + "/stderr";
    // What a child of `writers` writers traced, read from `from`: its trace file or its standard error.
    auto child = [&](int writers, const std::string& trace, const std::string& from) {
        wq5test::Collector child(std::filesystem::read_symlink("/proc/self/exe"),
                                 {{"MOQ_TEST_WRITERS", std::to_string(writers)}, {"MOQ_TEST_STDERR", err},
                                  {"MOQ_TRACE", trace}, {"MOQ_TRACE_FILE", from == err ? dir + "/no/trace" : from}});
        EXPECT_EQ(0, child.wait()) << "wait status of the writer child";
        std::vector<std::string> lines;
        std::istringstream in(wq5test::readFile(from));
        for (std::string line; std::getline(in, line);)
            lines.push_back(line + "\n");
        return lines;
    };
    expectWholeLines(child(4, "info", file), 4, {"mask <16>"});
    EXPECT_EQ("", wq5test::readFile(err)) << "no report for good settings";

    std::vector<std::string> lines = child(2, "loud", err);
    const auto reports = std::stable_partition(lines.begin(), lines.end(),
                                               [](const std::string& l) { return l.compare(0, 5, "moq: ") != 0; });
    ASSERT_EQ(2, lines.end() - reports);
    EXPECT_EQ(0u, reports[0].find("moq: MOQ_TRACE <loud> ")) << reports[0];
    EXPECT_EQ(0u, reports[1].find("moq: MOQ_TRACE_FILE <" + dir + "/no/trace> cannot be opened")) << reports[1];
    lines.erase(reports, lines.end());
    expectWholeLines(lines, 2, {"mask <208>"});  // the default mask, on standard error
    wq5test::removeTree(dir);
}

}  // namespace
