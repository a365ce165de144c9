// The real collector under load, its log read back by the checker: several
// library threads deliver thousands of tables at once while a 1 MB limit
// rolls the files over dozens of times; a SIGTERM lands in the middle of a
// load; every capture is replayed many times. Every entry carries its
// sequence number in its URL's query. WQ5_LONG_TESTS=1 makes the loads
// bigger.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include <sys/stat.h>

#include "support/capture_counts.h"
#include "support/process.h"
#include "support/stderr_capture.h"
#include "support/wq5check_run.h"
#include "wq5check_lib.h"

namespace {

using namespace wq5test;

const bool LONG_FORM = std::getenv("WQ5_LONG_TESTS") != nullptr && std::string(std::getenv("WQ5_LONG_TESTS")) == "1";
const std::chrono::seconds HANG(300);  // only catches hangs; nothing here judges speed
const int64_t LIMIT = 1048576, MAX_RECORD = 4096;
const char* const UNSET = "\x01unset";

// Table i is, by i % 3, an HTTP page with i % 9 objects (0/80), a video
// (1/0) or an audio (5/0) table. Entry n carries "seq=n" in its URL's query
// and a text of 300 to 2999 bytes, so that records end at every offset
// around the limit.
struct Script {
    std::string path;
    std::map<std::string, long> records;  // per tag
    std::vector<long> tableEnds;           // entries up to the end of each table
    int64_t textBytes = 0;                 // the long texts alone
};

Script writeScript(const std::string& path, long tables)
{
    Script script{path, {}, {}, 0};
    std::ofstream out(path);
    long seq = 0;
    const auto entry = [&](const std::string& fields, const std::string& url) {
        const std::string text(300 + seq * 89 % 2700, static_cast<char>('a' + seq % 26));
        script.textBytes += text.size();
        return "{" + fields + ",\"url\":\"" + url + "?seq=" + std::to_string(seq++) + "\",\"detailText2\":\"" + text +
               "\"}";
    };
    for (long i = 0; i < tables; ++i) {
        const std::string site = "http://load.example/t" + std::to_string(i) + "/";
        if (i % 3 == 0) {
            out << R"({"filter":[0,80],"entries":[)"
                << entry(R"("rdType":"HTTP","httpEntryType":1,"stampText":"Tue 2024-03-05 13:45:12 UTC")", site);
            for (long k = 0; k < i % 9; ++k)
                out << "," << entry(R"("rdType":"HTTP","httpEntryType":2)", site + std::to_string(k) + ".png");
            script.records["hpage"] += 1;
            script.records["hobj"] += i % 9;
        } else {
            const bool video = i % 3 == 1;
            out << "{\"filter\":[" << (video ? 1 : 5) << R"(,0],"entries":[)"
                << entry(video ? R"("rdType":"MSVD","mediaText":"WMV3")" : R"("rdType":"MSAU","mediaText":"WMA2")",
                         "mms://media.example/t" + std::to_string(i));
            ++script.records[video ? "video" : "audio"];
        }
        out << "]}\n";
        script.tableEnds.push_back(seq);
    }
    return script;
}

long counter(const std::string& status, const std::string& name)
{
    const size_t at = status.find("\"" + name + "\":");
    return at == std::string::npos ? -1 : std::stol(status.substr(at + name.size() + 3));
}

class LoadTest : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        s_dir = makeTempDir();
        s_script = writeScript(s_dir + "/load.jsonl", LONG_FORM ? 32000 : 8000);
    }
    static void TearDownTestSuite() { removeTree(s_dir); }

    // Runs the collector in `dir` with every switch on and 1 MB files until
    // `ready` holds (re-checked on each change in `dir`/`watch`; by default:
    // the library has written its status, being idle), stops it with
    // SIGTERM, checks that it stopped in order and returns the checker's
    // report on its log. The library's start delay lets the collector define
    // its filters before the first table comes.
    static wq5check::Report run(const std::string& dir, std::map<std::string, std::string> env,
                                const std::string& watch = "", std::function<bool()> ready = nullptr)
    {
        if (!ready)
            ready = [dir] { return access((dir + "/status.json").c_str(), F_OK) == 0; };
        EXPECT_EQ(0, mkdir(dir.c_str(), 0700));
        EXPECT_EQ(0, mkdir((dir + "/log").c_str(), 0700));
        env.insert({{"MOQ_TRACE", "error,flow"}, {"MOQ_TRACE_FILE", dir + "/trace.log"}, {"WQ5_WORK_PATH", UNSET},
                    {"WQ5_COLLECTOR_ID", "loadtest"}, {"WQ5_LOG_DIR", dir + "/log"},
                    {"WQ5_LOG_SAMPLE_PERCENTAGE", "100"}, {"WQ5_LOG_MAX_SIZE_MB", "1"}, {"WQ5_LOG_KEEPDAYS", UNSET},
                    {"WQ5_FIELD_DELIMITER", UNSET}, {"WQ5_SUB_CHAR", UNSET}, {"ZUB1_STATUS_FILE", dir + "/status.json"},
                    {"ZUB1_START_DELAY_MS", UNSET}, {"ZUB1_REGISTER_FAILURES", UNSET}, {"ZUB1_LOOPS", UNSET},
                    {"ZUB1_RATE", UNSET}});
        std::optional<Collector> collector;
        startAllKinds(collector, env, dir + "/stderr.txt");
        EXPECT_TRUE(collector->started());
        // A collector that dies on the way ends the wait at once; one that
        // hangs is killed when `collector` goes.
        int exit = -1;
        if (!waitFor(dir + watch, [&] { return ready() || (exit = collector->wait(std::chrono::seconds(0))) != -1; },
                     HANG) || exit != -1) {
            ADD_FAILURE() << dir << ": never got there; wait status " << exit;
            return {};
        }
        collector->signal(SIGTERM);
        exit = collector->wait(HANG);
        EXPECT_TRUE(exit != -1 && WIFEXITED(exit) && WEXITSTATUS(exit) == 0) << dir << ": wait status " << exit;
        const std::string trace = readFile(dir + "/trace.log");
        const size_t down = trace.find("Shutting down WQ5 Collector..."), stopped = trace.find("WQ5 Collector stopped.");
        EXPECT_TRUE(down != std::string::npos && stopped != std::string::npos && down < stopped) << dir;
        EXPECT_EQ(readFile(dir + "/stderr.txt"), "") << "the library reported a fault";
        wq5check::Report report =
            wq5check::checkDirectory(dir + "/log", {'^', env.at("ZUB1_REPLAY") == s_script.path ? "seq" : ""});
        std::cout << dir << ": " << report.total() << " records in " << report.files.size() << " files\n";
        return report;
    }

    static std::string s_dir;
    static Script s_script;
};
std::string LoadTest::s_dir;
Script LoadTest::s_script;

TEST_F(LoadTest, LibraryThreadsWriteEveryEntryOnceAndWholeAcrossRollovers)
{
    const long tables = static_cast<long>(s_script.tableEnds.size());
    for (const int threads : {2, 4, 8}) {
        SCOPED_TRACE(std::to_string(threads) + " library threads");
        const std::string dir = s_dir + "/threads" + std::to_string(threads);
        const wq5check::Report report =
            run(dir, {{"ZUB1_REPLAY", s_script.path}, {"ZUB1_THREADS", std::to_string(threads)}});
        EXPECT_TRUE(report.clean()) << wq5check::summary(report);
        EXPECT_EQ(report.distinct, s_script.tableEnds.back());
        EXPECT_EQ(report.records, s_script.records);
        const std::string status = readFile(dir + "/status.json");
        for (const auto& [name, value] : std::map<std::string, long>{{"tables", tables}, {"delivered", tables},
                                                                     {"freed", tables}, {"unmatched", 0},
                                                                     {"invalid", 0}, {"badFrees", 0}})
            EXPECT_EQ(counter(status, name), value) << name << " in " << status;
        // Each file but the last of its day went past the limit by one record.
        EXPECT_GE(static_cast<int64_t>(report.files.size()), s_script.textBytes / (LIMIT + MAX_RECORD));
        for (size_t i = 0; i + 1 < report.files.size(); ++i) {
            const auto size = static_cast<int64_t>(std::filesystem::file_size(dir + "/log/" + report.files[i]));
            if (report.files[i].compare(0, 8, report.files[i + 1], 0, 8) == 0) {
                EXPECT_TRUE(size > LIMIT && size <= LIMIT + MAX_RECORD) << report.files[i] << ": " << size;
            }
        }
        std::string printed;
        EXPECT_EQ(runWq5check({"--seq-field", "seq", dir + "/log"}, dir + "/check.txt", &printed), 0) << printed;
    }
}

TEST_F(LoadTest, SigtermInTheMiddleLeavesWholeTablesFromTheFirstOn)
{
    const std::string dir = s_dir + "/sigterm";
    const wq5check::Report report = run(
        dir, {{"ZUB1_REPLAY", s_script.path}, {"ZUB1_THREADS", "4"}, {"ZUB1_RATE", "500"}, {"MOQ_TRACE", "all"}},
        "/log", [dir] {
            const std::filesystem::directory_iterator files(dir + "/log");
            return std::any_of(begin(files), end(files),
                               [](const auto& file) { return file.path().string().find(".1.wq5") != std::string::npos; });
        });
    EXPECT_TRUE(report.clean()) << wq5check::summary(report);
    EXPECT_GE(report.files.size(), 2u);
    // The library hands out tables in script order, and the collector stops
    // only when every callback has returned: what reached the log is every
    // entry of the first tables and nothing else.
    const auto last = std::find(s_script.tableEnds.begin(), s_script.tableEnds.end(), report.distinct);
    ASSERT_NE(last, s_script.tableEnds.end()) << report.distinct << " entries end inside a table";
    // The library writes its counts only when idle, which a load cut short
    // never is; the collector traces each HTTP table it takes and gives back.
    const long httpTables = (last - s_script.tableEnds.begin()) / 3 + 1;
    EXPECT_EQ(countIn(dir + "/trace.log", "Handling http callback answer area"), httpTables);
    EXPECT_EQ(countIn(dir + "/trace.log", "Freeing  http callback answer area"), httpTables);
}

TEST_F(LoadTest, EveryCaptureLoopedGivesItsRecordsTimesTheLoops)
{
    const long loops = LONG_FORM ? 1000 : 50;
    const char* const tags[] = {"hpage", "hobj", "video", "audio"};
    for (const CaptureRow& row : CAPTURE_ROWS) {
        std::map<std::string, long> expected;
        long perPass = 0;
        for (int i = 0; i < 4; ++i) {
            if (row.records[i] != 0) expected[tags[i]] = loops * row.records[i];
            perPass += row.records[i];
        }
        if (row.error != nullptr || perPass == 0) continue;  // a pass without tables ends the replay
        SCOPED_TRACE(row.file);
        const std::string dir = s_dir + "/" + row.file;
        const wq5check::Report report = run(
            dir, {{"ZUB1_REPLAY", capturePath(row.file)}, {"ZUB1_THREADS", "4"}, {"ZUB1_LOOPS", std::to_string(loops)}});
        EXPECT_TRUE(report.clean()) << wq5check::summary(report);
        EXPECT_EQ(report.records, expected) << wq5check::summary(report);
        const std::string status = readFile(dir + "/status.json");
        EXPECT_EQ(counter(status, "entries"), loops * (perPass + row.skipped)) << status;
        EXPECT_TRUE(counter(status, "delivered") == counter(status, "freed") && counter(status, "badFrees") == 0 &&
                    counter(status, "unmatched") == 0)
            << status;
    }
}

}  // namespace
