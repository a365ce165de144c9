// Parts A to F: the collector's record path in process, the floor it is
// measured against, spdlog writing the same lines, formatting alone,
// several delivering threads, and rollover in a crowded directory.
//
// One iteration is one table: ten records. Every part counts records as
// items and record bytes as bytes, so that all rates compare directly.
#include <benchmark/benchmark.h>

#include <cstdint>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <spdlog/logger.h>
#include <spdlog/sinks/basic_file_sink.h>

#include "libmoq/moq_control.h"
#include "parts.h"
#include "platform/moq.h"
#include "src/mdwriter.h"
#include "workload.h"

namespace wq5bench {

namespace {

std::vector<std::string> g_records;  // one table's records, as the collector writes them
int64_t g_tableBytes = 0;

void countTables(benchmark::State& state)
{
    state.SetItemsProcessed(state.iterations() * RECORDS_PER_TABLE);
    state.SetBytesProcessed(state.iterations() * g_tableBytes);
}

// ------------------------------------------------------------------ A, E

// Shared by the threads of one run of part E; built by thread 0 before
// the timed loop, whose start and end are barriers for all threads.
std::unique_ptr<TempDir> g_sharedDir;
std::unique_ptr<Collector> g_shared;

void recordPath(benchmark::State& state, long maxSizeMb)
{
    if (state.thread_index() == 0) {
        g_sharedDir.reset(new TempDir("A"));
        g_shared.reset(new Collector(g_sharedDir->path(), maxSizeMb));
        // The first record opens the file; a run measures the steady state.
        g_shared->handler().processHttp(buildTable()->table());
    }
    std::unique_ptr<wq5test::TableBuilder> table = buildTable();
    for (auto _ : state)
        g_shared->handler().processHttp(table->table());
    if (state.thread_index() == 0) {
        g_shared.reset();
        g_sharedDir.reset();
    }
    countTables(state);
}

// -------------------------------------------------------------------- B

// One fwrite and one fflush per record, the clock read per record and,
// with a limit, the same status query per record; nothing else.
void floorWrite(benchmark::State& state, bool limited)
{
    TempDir dir("B");
    FILE* stream = fopen64((dir.path() + "/floor.wq5").c_str(), "a");
    if (stream == nullptr) {
        state.SkipWithError("cannot open the floor's file");
        return;
    }
    const int64_t limit = UNREACHED_LIMIT_MB * 1048576;
    for (auto _ : state) {
        for (const std::string& record : g_records) {
            time_t now = time(nullptr);
            benchmark::DoNotOptimize(now);
            if (limited) {
                struct stat64 status;
                bool over = fstat64(fileno(stream), &status) == 0 && status.st_size > limit;
                benchmark::DoNotOptimize(over);
            }
            fwrite(record.data(), 1, record.size(), stream);
            fflush(stream);
        }
    }
    fclose(stream);
    countTables(state);
}

// -------------------------------------------------------------------- C

// A logger as a user would set it up for these lines: a thread-safe file
// sink, the message alone as the pattern, a flush after every message.
void spdlogWrite(benchmark::State& state)
{
    TempDir dir("C");
    auto sink = std::make_shared<spdlog::sinks::basic_file_sink_mt>(dir.path() + "/spdlog.wq5");
    spdlog::logger logger("wq5", sink);
    logger.set_pattern("%v");
    logger.flush_on(spdlog::level::trace);
    std::vector<std::string> messages;
    for (const std::string& record : g_records)
        messages.push_back(record.substr(0, record.size() - 1));  // the sink adds the newline
    for (auto _ : state)
        for (const std::string& message : messages)
            logger.info(message);
    countTables(state);
}

// -------------------------------------------------------------------- D

// The formatting of processHttp without its write: a GUID per page, then
// header, common and HTTP columns and footer into the record buffer.
void formatOnly(benchmark::State& state)
{
    TempDir dir("D");
    Collector collector(dir.path(), 0);
    DataHandler& handler = collector.handler();
    std::unique_ptr<wq5test::TableBuilder> table = buildTable();
    std::vector<char> buffer(RECORD_BUFFER_SIZE);
    std::string guid;
    for (auto _ : state) {
        for (int i = 0; i < RECORDS_PER_TABLE; ++i) {
            ZUB_RESPONSE_TIME_DATA* entry = &table->entry(i);
            const bool page = entry->detail.view.http.httpEntryType == 1;
            if (page)
                guid = handler.generateGuid();
            const char* tag = page ? TAG_HTTPPAGE : TAG_HTTPOBJ;
            char* at = buffer.data();
            char* const end = at + buffer.size();
            at += handler.addHeader(at, static_cast<size_t>(end - at), tag, guid);
            at += handler.addCommon(at, static_cast<size_t>(end - at), entry);
            at += handler.addHttpMain(at, static_cast<size_t>(end - at), entry);
            at += handler.addFooter(at, static_cast<size_t>(end - at), tag);
            benchmark::DoNotOptimize(buffer.data());
            benchmark::ClobberMemory();
        }
    }
    countTables(state);
}

// -------------------------------------------------------------------- F

// The day's files 1 to OLDER_FILES (empty), so that the day's latest is the
// last of them and every open names and scans past all of them.
void makeOlderFiles(const std::string& dir)
{
    std::string date;
    time2str(calcPeriodStart(86400), date);
    for (int seq = 1; seq <= OLDER_FILES; ++seq) {
        const std::string name = dir + "/" + date + "." + std::to_string(seq) + ".wq5";
        const int fd = open(name.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
        if (fd >= 0)
            close(fd);
    }
}

long countFiles(const std::string& dir)
{
    long files = 0;
    std::error_code error;
    for (auto it = std::filesystem::directory_iterator(dir, error); !error && it != decltype(it)(); it.increment(error))
        ++files;
    return files;
}

// The record path under a 1 MiB limit: a rollover every ~1500 records.
void rollover(benchmark::State& state)
{
    TempDir dir("F");
    makeOlderFiles(dir.path());
    Collector collector(dir.path(), 1);
    std::unique_ptr<wq5test::TableBuilder> table = buildTable();
    collector.handler().processHttp(table->table());
    const long before = countFiles(dir.path());
    for (auto _ : state)
        collector.handler().processHttp(table->table());
    const long opens = countFiles(dir.path()) - before;
    countTables(state);
    state.counters["opens"] = benchmark::Counter(static_cast<double>(opens), benchmark::Counter::kIsRate);
}

// What one open costs on its own with the older files present: naming
// (the day's files expanded and their numbers parsed) and retention (the
// directory scanned, one status query per entry). Tracing as the collector
// runs by default, or with errors only.
enum class OpenStep { Naming, Retention };

void openStep(benchmark::State& state, OpenStep step, bool traceOff)
{
    TempDir dir("F-open");
    makeOlderFiles(dir.path());
    DataWriter writer(dir.path(), "wq5", 7, 1);
    const wq5_time_t period = calcPeriodStart(86400);
    const int savedMask = MOQ_GetMask();
    if (traceOff)
        MOQ_SetMask(TRC_ERROR);
    std::string name;
    for (auto _ : state) {
        if (step == OpenStep::Naming)
            writer.getLogfileName(period, name);
        else
            writer.deleteOldFiles(period);
    }
    MOQ_SetMask(savedMask);
    state.SetItemsProcessed(state.iterations());
}

}  // namespace

void registerRecordPath(double minTime, int repetitions)
{
    g_records = recordLines();
    g_tableBytes = static_cast<int64_t>(tableBytes(g_records));

    auto add = [&](const char* name, auto&& fn) {
        return benchmark::RegisterBenchmark(name, fn)->MinTime(minTime)->Repetitions(repetitions)->ReportAggregatesOnly(
            repetitions > 1);
    };
    add("A/no_limit", [](benchmark::State& s) { recordPath(s, 0); });
    add("A/limit", [](benchmark::State& s) { recordPath(s, UNREACHED_LIMIT_MB); });
    add("B/no_limit", [](benchmark::State& s) { floorWrite(s, false); });
    add("B/limit", [](benchmark::State& s) { floorWrite(s, true); });
    add("C/spdlog", spdlogWrite);
    add("D/format", formatOnly);
    add("E/threads", [](benchmark::State& s) { recordPath(s, 0); })->Threads(1)->Threads(2)->Threads(4)->UseRealTime();
    add("F/rollover", rollover);
    add("F/naming", [](benchmark::State& s) { openStep(s, OpenStep::Naming, false); });
    add("F/naming_trace_off", [](benchmark::State& s) { openStep(s, OpenStep::Naming, true); });
    add("F/retention", [](benchmark::State& s) { openStep(s, OpenStep::Retention, false); });
}

}  // namespace wq5bench
