// Tests of libmoq: settings, environment, mask caching, line format and
// whole lines under concurrency (through a sink and in a real trace file).
#include <fcntl.h>
#include <regex.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <map>
#include <thread>

#include "libmoq/moq_control.h"
#include "libmoq/moq_settings.h"
#include "platform/moq.h"
#include "support/trace_capture.h"

extern char** environ;

namespace {

TRC1_CUB s_unit = TRC1_UNIT_INIT("moq_test");
TRC1_CUB s_otherUnit = TRC1_UNIT_INIT("moq_other");
const int WRITER_LINES = 250;

std::string payload(int writer, int n)
{
    return "writer <" + std::to_string(writer) + "> line <" + std::to_string(n) + "> " +
           std::string(2000, static_cast<char>('a' + writer));
}

void writeLines(int writer)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "writeLines");
    for (int n = 0; n < WRITER_LINES; ++n)
        if (trc1Mask(&blk) & TRC_INFO)
            TRC1_Printf(&blk, __LINE__, "%s", payload(writer, n).c_str());
}

// Writer mode, before main: started with MOQ_TEST_WRITERS=<n>, this binary
// traces its mask, then runs n writer threads and exits.
int writerMode()
{
    const char* writers = std::getenv("MOQ_TEST_WRITERS");
    if (writers == nullptr)
        return 0;
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "writerMode");
    TRC1_Printf(&blk, __LINE__, "mask <%d>", trc1Mask(&blk));
    std::vector<std::thread> threads;
    for (int w = 0; w < std::atoi(writers); ++w)
        threads.emplace_back(writeLines, w);
    for (std::thread& t : threads)
        t.join();
    _exit(0);
}
const int s_writerMode = writerMode();

// Runs this binary in writer mode with `settings` in place of our MOQ_
// variables, stderr to `errPath`; returns the wait status.
int runWriters(int writers, std::vector<std::string> settings, const std::string& errPath)
{
    for (char** e = environ; *e != nullptr; ++e)
        if (std::strncmp(*e, "MOQ_", 4) != 0)
            settings.emplace_back(*e);
    settings.push_back("MOQ_TEST_WRITERS=" + std::to_string(writers));
    std::vector<char*> envp;
    for (std::string& v : settings)
        envp.push_back(&v[0]);
    envp.push_back(nullptr);
    std::string exe = std::filesystem::read_symlink("/proc/self/exe");
    char* argv[] = {&exe[0], nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    pid_t pid = -1;
    int status = -1;
    if (posix_spawn(&pid, exe.c_str(), &actions, nullptr, argv, envp.data()) == 0)
        waitpid(pid, &status, 0);
    posix_spawn_file_actions_destroy(&actions);
    return status;
}

struct TempDir {
    char path[32] = "/tmp/moq_test.XXXXXX";
    TempDir() { EXPECT_NE(mkdtemp(path), nullptr); }
    ~TempDir() { std::filesystem::remove_all(path); }
    std::string operator/(const char* name) const { return std::string(path) + "/" + name; }
};

std::vector<std::string> readLines(const std::string& path)
{
    std::ifstream in(path);
    std::vector<std::string> lines;
    for (std::string line; std::getline(in, line);)
        lines.push_back(line + "\n");
    return lines;
}

// Splits a line into its prefix "<time> [<tid>] <unit>:<line> <function>: "
// and its text; false when the prefix or the one final newline is wrong.
bool splitLine(const std::string& line, std::string* prefix, std::string* text)
{
    static regex_t format;
    static const int compiled = regcomp(&format,
        "^[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{6}Z \\[[0-9]+\\] moq_[a-z]+:[0-9]+ [^ ]+: $",
        REG_EXTENDED | REG_NOSUB);
    const size_t cut = line.find(": ");
    if (compiled != 0 || cut == std::string::npos || line.find('\n') != line.size() - 1)
        return false;
    *prefix = line.substr(0, cut + 2);
    *text = line.substr(cut + 2, line.size() - cut - 3);
    return regexec(&format, prefix->c_str(), 0, nullptr, 0) == 0;
}

// Expects `lines` to be the payloads of `writers` writers, each whole and
// once, and the lines whose texts are `others`.
void expectWriterLines(const std::vector<std::string>& lines, int writers, std::vector<std::string> others)
{
    std::map<std::pair<int, int>, int> seen;
    for (const std::string& line : lines) {
        std::string prefix, text;
        ASSERT_TRUE(splitLine(line, &prefix, &text)) << "malformed line: " << line.substr(0, 200);
        int w = -1, n = -1;
        auto other = std::find(others.begin(), others.end(), text);
        if (std::sscanf(text.c_str(), "writer <%d> line <%d>", &w, &n) == 2 && text == payload(w, n))
            ++seen[{w, n}];
        else if (other != others.end())
            others.erase(other);
        else
            ADD_FAILURE() << "unexpected text: " << text.substr(0, 200);
    }
    EXPECT_TRUE(others.empty()) << "missing: " << (others.empty() ? "" : others[0]);
    EXPECT_EQ(seen.size(), static_cast<size_t>(writers * WRITER_LINES));
    for (const auto& entry : seen)
        EXPECT_EQ(entry.second, 1) << "writer " << entry.first.first << " line " << entry.first.second;
}

TEST(MoqSettings, MaskParsing)
{
    const struct { const char* text; bool ok; int mask; } rows[] = {
        {"0", true, 0},  {"208", true, 0xD0},  {"0x10", true, TRC_INFO},  {"0XD1", true, 0xD1},
        {"2147483647", true, 2147483647},  {"0x7fffffff", true, 2147483647},  {"010", true, 10},
        {"error", true, TRC_ERROR},  {"detail", true, TRC_DETAIL},  {"error,flow,info", true, 0xD0},
        {"all", true, 0xD1},  {"none", true, 0},  {"none,flow", true, TRC_FLOW},  {" Info , ERROR ", true, 0x90},
        {"", false, 0},  {"2147483648", false, 0},  {"0x80000000", false, 0},  {"99999999999999999999", false, 0},
        {"-1", false, 0},  {"+1", false, 0},  {"0x", false, 0},  {"0x1g", false, 0},  {"12abc", false, 0},
        {"err", false, 0},  {"error,", false, 0},  {",error", false, 0},  {"error,,flow", false, 0},
        {"error flow", false, 0},  {"everything", false, 0},
    };
    for (const auto& row : rows) {
        int mask = -7;
        EXPECT_EQ(moq::parseMask(row.text, &mask), row.ok) << "<" << row.text << ">";
        EXPECT_EQ(mask, row.ok ? row.mask : -7) << "<" << row.text << ">";
    }
}

TEST(MoqSettings, BadValuesAreReportedOnceAndDefaulted)
{
    TempDir dir;
    const std::string bad = dir / "missing/trace.log";
    ASSERT_EQ(runWriters(2, {"MOQ_TRACE=loud", "MOQ_TRACE_FILE=" + bad}, dir / "stderr"), 0);
    std::vector<std::string> lines = readLines(dir / "stderr");
    const auto reports = std::stable_partition(lines.begin(), lines.end(),
                                               [](const std::string& l) { return l.compare(0, 5, "moq: ") != 0; });
    ASSERT_EQ(lines.end() - reports, 2);
    EXPECT_EQ(reports[0].find("moq: MOQ_TRACE <loud> "), 0u) << reports[0];
    EXPECT_EQ(reports[1].find("moq: MOQ_TRACE_FILE <" + bad + "> cannot be opened"), 0u) << reports[1];
    lines.erase(reports, lines.end());
    expectWriterLines(lines, 2, {"mask <208>"});  // the default mask, and the trace on stderr
}

TEST(MoqEnv, GetEnv)
{
    setenv("MOQ_TEST_SET", "value", 1);
    setenv("MOQ_TEST_EMPTY", "", 1);
    unsetenv("MOQ_TEST_UNSET");
    const struct { const char* name; const char* dflt; const char* expected; } rows[] = {
        {"MOQ_TEST_SET", "dflt", "value"},  {"MOQ_TEST_SET", nullptr, "value"},
        {"MOQ_TEST_EMPTY", "dflt", "dflt"},  {"MOQ_TEST_EMPTY", nullptr, nullptr},
        {"MOQ_TEST_UNSET", "dflt", "dflt"},  {"MOQ_TEST_UNSET", nullptr, nullptr},
    };
    for (const auto& row : rows)
        EXPECT_STREQ(QEN1_GetEnv(row.name, row.dflt), row.expected) << row.name << " " << (row.dflt ? "dflt" : "null");
}

TEST(MoqMask, BlocksFollowSetMaskAlsoUnderConcurrentUse)
{
    static TRC1_EPB blocks[] = {TRC1_BLOCK_INIT(s_unit, "x"), TRC1_BLOCK_INIT(s_otherUnit, "y")};
    const int old = MOQ_GetMask();
    for (int mask : {TRC_DETAIL, TRC_ERROR | TRC_FLOW, 0}) {
        MOQ_SetMask(mask);
        EXPECT_EQ(MOQ_GetMask(), mask);
        for (TRC1_EPB& blk : blocks)
            EXPECT_EQ(trc1Mask(&blk), mask) << blk.funcName;
    }
    std::atomic<bool> stop{false};
    std::vector<std::thread> readers;
    for (int t = 0; t < 4; ++t)
        readers.emplace_back([&] {
            while (!stop.load())
                for (TRC1_EPB& blk : blocks)
                    (void)trc1Mask(&blk);
        });
    for (int mask = 1; mask <= 2000; ++mask)
        MOQ_SetMask(mask);
    stop = true;
    for (std::thread& t : readers)
        t.join();
    for (TRC1_EPB& blk : blocks)
        EXPECT_EQ(trc1Mask(&blk), 2000) << blk.funcName << " after concurrent refreshes";
    MOQ_SetMask(old);
}

TEST(MoqFormat, MessagesAndEvents)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "Fmt::pvomain");
    TraceCapture capture(TRC_FLOW);
    // The clock the lines are stamped with; time() may lag it by a tick.
    auto now = [] { timespec ts; clock_gettime(CLOCK_REALTIME, &ts); return ts.tv_sec; };
    const time_t before = now();
    errno = EACCES;
    TRC1_Printf(&blk, 10, "value <%d> name <%s>", 42, "n");
    EXPECT_EQ(errno, EACCES) << "tracing keeps errno";
    TRC1_Event(&blk, 11, TRC1_ENTRY);
    TRC1_Event(&blk, 12, TRC1_EXIT_VALUE, -1);
    TRC1_Event(&blk, 13, TRC1_EXIT);
    TRC1_Event(&blk, 14, 9);
    const time_t after = now();
    const char* expected[] = {"value <42> name <n>", "> Fmt::pvomain", "< Fmt::pvomain rc=-1", "< Fmt::pvomain",
                              "? Fmt::pvomain kind=9"};
    const std::vector<std::string> lines = capture.lines();
    ASSERT_EQ(lines.size(), 5u);
    for (size_t i = 0; i < lines.size(); ++i) {
        std::string prefix, text;
        EXPECT_TRUE(splitLine(lines[i], &prefix, &text)) << lines[i];
        EXPECT_EQ(text, expected[i]);
        EXPECT_NE(prefix.find("] moq_test:" + std::to_string(10 + i) + " Fmt::pvomain: "), std::string::npos) << prefix;
        struct tm utc = {};
        ASSERT_TRUE(strptime(prefix.c_str(), "%Y-%m-%dT%H:%M:%S", &utc)) << prefix;
        EXPECT_TRUE(timegm(&utc) >= before && timegm(&utc) <= after) << prefix << " is not UTC now";
    }
}

TEST(MoqFormat, EscapesAndLength)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "escape");
    const std::string exact(moq::MAX_MESSAGE, 'm'), over(moq::MAX_MESSAGE + 10, 'm');
    const struct { std::string message; std::string expected; } rows[] = {
        {"plain <ok> ~!", "plain <ok> ~!"},  {"a\nb\rc\td", "a\\nb\\rc\\td"},  {"back\\slash", "back\\\\slash"},
        {"\x01\x1f\x7f", "\\x01\\x1f\\x7f"},  {"caf\xc3\xa9", "caf\\xc3\\xa9"},  {exact, exact},
        {over, exact + " [cut at 65536 of 65546 bytes]"},
    };
    for (const auto& row : rows) {
        TraceCapture capture(TRC_INFO);
        TRC1_Printf(&blk, __LINE__, "%s", row.message.c_str());
        ASSERT_EQ(capture.lines().size(), 1u);
        std::string prefix, text;
        EXPECT_TRUE(splitLine(capture.lines()[0], &prefix, &text)) << row.expected.substr(0, 40);
        EXPECT_EQ(text, row.expected) << row.expected.substr(0, 40);
    }
    TraceCapture capture(TRC_INFO);
    TRC1_Printf(&blk, 7, "nul<%c>", 0);  // a NUL byte can come only from %c
    EXPECT_EQ(capture.count("] moq_test:7 escape: nul<\\x00>"), 1);
}

struct LineSink {
    std::mutex lock;
    std::vector<std::string> lines;
    static void take(void* context, const char* line, size_t length)
    {
        LineSink* self = static_cast<LineSink*>(context);
        std::lock_guard<std::mutex> g(self->lock);
        self->lines.emplace_back(line, length);
    }
};

TEST(MoqConcurrency, SinkSwitchedWhileTracingGetsWholeLinesOnce)
{
    const int old = MOQ_GetMask();
    MOQ_SetMask(TRC_INFO);
    LineSink sinks[2];
    MOQ_SetSink(&LineSink::take, &sinks[0]);
    std::vector<std::thread> writers;
    for (int w = 0; w < 4; ++w)
        writers.emplace_back(writeLines, w);
    for (int i = 1; i <= 200; ++i)
        MOQ_SetSink(&LineSink::take, &sinks[i % 2]);
    for (std::thread& t : writers)
        t.join();
    MOQ_SetSink(nullptr, nullptr);
    MOQ_SetMask(old);
    sinks[0].lines.insert(sinks[0].lines.end(), sinks[1].lines.begin(), sinks[1].lines.end());
    expectWriterLines(sinks[0].lines, 4, {});
}

TEST(MoqConcurrency, TraceFileOfChildHoldsWholeLinesOnce)
{
    TempDir dir;
    ASSERT_EQ(runWriters(4, {"MOQ_TRACE=info", "MOQ_TRACE_FILE=" + (dir / "trace.log")}, dir / "stderr"), 0);
    EXPECT_EQ(readLines(dir / "stderr").size(), 0u) << "no report for good settings";
    expectWriterLines(readLines(dir / "trace.log"), 4, {"mask <16>"});
}

}  // namespace
