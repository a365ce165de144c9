// wq5bench: measures the collector's record path against the cost of one
// flushed write per record, and the whole collector process, and prints
// one table (also written to a file) of absolute rates, ratios and goals.
//
//   wq5bench [--smoke] [--out FILE] [--collector PATH] [--tables N] [--benchmark_...]
//
// --smoke runs every part briefly (CI: it must keep working, its numbers
// mean nothing). Other --benchmark_ options go to Google Benchmark, for
// instance --benchmark_filter=A/ to run part of it (part G then only runs
// with --tables given).
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <iostream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>
#include <sys/utsname.h>
#include <unistd.h>

#include "parts.h"
#include "workload.h"

namespace wq5bench {
namespace {

struct Options {
    bool smoke = false;
    std::string out = "wq5bench-results.md";
    std::string collector = WQ5_COLLECTOR_PATH;
    long tables = 0;  // part G's smaller size; 0: the mode's default
    bool filtered = false;
};

// The median (or only) run of every measurement, by name.
struct Measured {
    double itemsPerSecond = 0;
    double bytesPerSecond = 0;
    std::map<std::string, double> counters;
};

class TableReporter : public benchmark::ConsoleReporter {
public:
    TableReporter() : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_ColorTabular : OO_Tabular) {}

    void ReportRuns(const std::vector<Run>& runs) override
    {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& run : runs) {
            const bool wanted = run.run_type == Run::RT_Aggregate ? run.aggregate_name == "median" : runs.size() == 1;
            if (run.error_occurred)
                failed.push_back(run.benchmark_name() + ": " + run.error_message);
            if (!wanted || run.error_occurred)
                continue;
            Measured m;
            for (const auto& counter : run.counters) {
                if (counter.first == "items_per_second")
                    m.itemsPerSecond = counter.second.value;
                else if (counter.first == "bytes_per_second")
                    m.bytesPerSecond = counter.second.value;
                else
                    m.counters[counter.first] = counter.second.value;
            }
            // The registered name, and the thread count where there is one.
            const std::string& threads = run.run_name.threads;
            results[run.run_name.function_name + (threads.empty() ? "" : "/" + threads)] = m;
        }
    }

    std::map<std::string, Measured> results;
    std::vector<std::string> failed;  // measurements that could not run
};

std::string fixed(double value, int decimals)
{
    char text[64];
    snprintf(text, sizeof text, "%.*f", decimals, value);
    return text;
}

// 1234567 -> "1,234,567"
std::string grouped(double value)
{
    std::string digits = fixed(value, 0);
    for (int at = static_cast<int>(digits.size()) - 3; at > 0 && digits[at - 1] != '-'; at -= 3)
        digits.insert(static_cast<size_t>(at), ",");
    return digits;
}

struct Row {
    std::string part, what, rate, mbps, ratio, goal, met;
};

class Table {
public:
    explicit Table(const std::map<std::string, Measured>& results) : m_results(results) {}

    const Measured* find(const std::string& name) const
    {
        auto it = m_results.find(name);
        return it == m_results.end() ? nullptr : &it->second;
    }
    double rate(const std::string& name) const
    {
        const Measured* m = find(name);
        return m != nullptr ? m->itemsPerSecond : 0;
    }
    void add(Row row) { m_rows.push_back(std::move(row)); }
    // A row of records per second and MB/s for a measurement that ran.
    void addRate(const std::string& part, const std::string& name, const std::string& what, Row extra = Row())
    {
        const Measured* m = find(name);
        if (m == nullptr)
            return;
        extra.part = part;
        extra.what = what;
        extra.rate = grouped(m->itemsPerSecond);
        extra.mbps = m->bytesPerSecond > 0 ? fixed(m->bytesPerSecond / 1e6, 1) : "";
        m_rows.push_back(extra);
    }
    std::string markdown() const
    {
        std::ostringstream out;
        out << "| Part | Measurement | records/s | MB/s | Ratio, detail | Goal | Met |\n"
            << "|---|---|--:|--:|---|---|---|\n";
        for (const Row& r : m_rows)
            out << "| " << r.part << " | " << r.what << " | " << r.rate << " | " << r.mbps << " | " << r.ratio
                << " | " << r.goal << " | " << r.met << " |\n";
        return out.str();
    }

private:
    const std::map<std::string, Measured>& m_results;
    std::vector<Row> m_rows;
};

const char* yesNo(bool met)
{
    return met ? "yes" : "**no**";
}

// Ratio text "A/B 0.93" and whether it reaches `goal`; empty when either
// side did not run.
std::string ratioText(const char* label, double a, double b, double goal, bool* met)
{
    if (a <= 0 || b <= 0)
        return "";
    *met = *met && a / b >= goal;
    return std::string(label) + " " + fixed(a / b, 2);
}

void addRecordPathRows(Table& t)
{
    const double c = t.rate("C/spdlog");
    const struct {
        const char* variant;
        const char* what;
    } aParts[] = {{"no_limit", "record path, no size limit"}, {"limit", "record path, size limit (fstat per record)"}};
    for (const auto& a : aParts) {
        const double rateA = t.rate(std::string("A/") + a.variant);
        const double rateB = t.rate(std::string("B/") + a.variant);
        bool met = true;
        Row row;
        row.ratio = ratioText("A/B", rateA, rateB, 0.85, &met);
        const std::string vsC = ratioText("A/C", rateA, c, 1.0, &met);
        row.ratio += (row.ratio.empty() || vsC.empty() ? "" : ", ") + vsC;
        row.goal = "A/B ≥ 0.85, A/C ≥ 1.0";
        row.met = row.ratio.empty() ? "" : yesNo(met);
        t.addRate("A", std::string("A/") + a.variant, a.what, row);
    }
    t.addRate("B", "B/no_limit", "floor: fwrite + fflush per record, clock read");
    t.addRate("B", "B/limit", "floor with fstat per record");
    t.addRate("C", "C/spdlog", "spdlog basic_file_sink_mt, \"%v\", flush every message");

    Row d;
    const double rateD = t.rate("D/format");
    d.goal = "≥ 1,000,000 records/s";
    d.met = yesNo(rateD >= 1e6);
    t.addRate("D", "D/format", "formatting alone (GUID, header, common, HTTP, footer)", d);

    const double single = t.rate("E/threads/threads:1");
    for (int threads : {1, 2, 4}) {
        const std::string name = "E/threads/threads:" + std::to_string(threads);
        Row e;
        bool met = true;
        e.ratio = ratioText("vs 1 thread", t.rate(name), single, 0.9, &met);
        if (threads > 1) {
            e.goal = "≥ 0.9 × 1 thread";
            e.met = e.ratio.empty() ? "" : yesNo(met);
        }
        t.addRate("E", name, "record path, " + std::to_string(threads) + " thread(s) at once, total", e);
    }

    const Measured* f = t.find("F/rollover");
    if (f != nullptr) {
        Row row;
        const double opens = f->counters.count("opens") ? f->counters.at("opens") : 0;
        bool ignored = true;
        row.ratio = ratioText("F/A(limit)", f->itemsPerSecond, t.rate("A/limit"), 0, &ignored);
        row.goal = "reported: " + fixed(opens, 0) + " opens/s";
        t.addRate("F", "F/rollover", "rollover at 1 MiB, " + std::to_string(OLDER_FILES) + " older files of the day",
                  row);
    }
    const struct {
        const char* name;
        const char* what;
    } steps[] = {{"F/naming", "one open: naming (glob + parse), default trace"},
                 {"F/naming_trace_off", "one open: naming, trace errors only"},
                 {"F/retention", "one open: retention scan (readdir + stat)"}};
    for (const auto& step : steps) {
        const double perSecond = t.rate(step.name);
        if (perSecond > 0)
            t.add({"F", step.what, "", "", fixed(1e6 / perSecond, 0) + " µs per open", "reported", ""});
    }
}

void addProcessRows(Table& t, const ProcessRun& small, const ProcessRun& large)
{
    const double limitKiB = 8 * 1024;
    for (const ProcessRun* run : {&small, &large}) {
        Row row;
        row.part = "G";
        row.what = "collector process, " + grouped(static_cast<double>(run->tables)) + " tables";
        if (!run->complete) {
            row.met = "**failed**: " + run->problem;
            t.add(row);
            continue;
        }
        row.rate = grouped(run->recordsPerSecond);
        row.mbps = fixed(run->megabytesPerSecond, 1);
        row.ratio = "peak " + fixed(run->peakKiB / 1024.0, 2) + " MiB, resident " +
                    fixed(run->residentKiB / 1024.0, 2) + " MiB";
        row.goal = "peak ≤ 8 MiB";
        row.met = yesNo(run->peakKiB <= limitKiB);
        t.add(row);
    }
    if (small.complete && large.complete) {
        // Resident memory once every table was given back. "No growth":
        // within what the allocator keeps or returns by chance, far below
        // one byte per table of the larger run.
        const long growth = large.residentKiB - small.residentKiB;
        const long slackKiB = 256;
        t.add({"G", "resident growth from " + grouped(static_cast<double>(small.tables)) + " to " +
                        grouped(static_cast<double>(large.tables)) + " tables",
               "", "", (growth >= 0 ? "+" : "") + std::to_string(growth) + " KiB",
               "no growth (≤ " + std::to_string(slackKiB) + " KiB)", yesNo(growth <= slackKiB)});
    }
}

std::string firstLine(const std::string& path, const std::string& key)
{
    std::ifstream in(path);
    for (std::string line; std::getline(in, line);)
        if (line.compare(0, key.size(), key) == 0) {
            const auto colon = line.find(':');
            return colon == std::string::npos ? line : line.substr(line.find_first_not_of(" \t", colon + 1));
        }
    return "unknown";
}

// Where the benchmark ran: processor, cores, kernel, and the file system
// and device of the temporary directory that the log files went to.
std::string machine()
{
    struct utsname name;
    uname(&name);
    const char* tmp = std::getenv("TMPDIR");
    const std::string dir = tmp != nullptr && tmp[0] != '\0' ? tmp : "/tmp";
    struct statfs fs;
    std::string fsType = "unknown";
    if (statfs(dir.c_str(), &fs) == 0) {
        const std::map<long, const char*> types = {{0xEF53, "ext4"}, {0x58465342, "xfs"}, {0x01021994, "tmpfs"},
                                                   {0x9123683E, "btrfs"}, {0x794c7630, "overlayfs"}};
        auto it = types.find(static_cast<long>(fs.f_type));
        char hex[32];
        snprintf(hex, sizeof hex, "type 0x%lx", static_cast<unsigned long>(fs.f_type));
        fsType = it != types.end() ? it->second : hex;
    }
    std::string device = "unknown";
    struct stat st;
    if (stat(dir.c_str(), &st) == 0) {
        const std::string sys = "/sys/dev/block/" + std::to_string(major(st.st_dev)) + ":" + std::to_string(minor(st.st_dev));
        device = firstLine(sys + "/uevent", "DEVNAME=");
        if (device != "unknown")
            device = device.substr(device.find('=') + 1);
        std::ifstream rotational(sys + "/queue/rotational");
        int spinning = -1;
        if (rotational >> spinning)
            device += ", queue/rotational=" + std::to_string(spinning);
    }
    std::ostringstream out;
    out << "- Processor: " << firstLine("/proc/cpuinfo", "model name") << ", " << sysconf(_SC_NPROCESSORS_ONLN)
        << " cores online\n"
        << "- Kernel: " << name.sysname << " " << name.release << " " << name.machine << "\n"
        << "- Log files in: " << dir << " (" << fsType << " on " << device << ")\n";
    return out.str();
}

// The load of the machine (1, 5 and 15 minutes): other work on the same
// cores shows in every number.
std::string loadAverage()
{
    std::ifstream in("/proc/loadavg");
    double one = 0, five = 0, fifteen = 0;
    if (!(in >> one >> five >> fifteen))
        return "unknown";
    return fixed(one, 2) + " " + fixed(five, 2) + " " + fixed(fifteen, 2);
}

std::string timestamp()
{
    char text[32];
    const time_t now = time(nullptr);
    struct tm fields;
    strftime(text, sizeof text, "%Y-%m-%d %H:%M UTC", gmtime_r(&now, &fields));
    return text;
}

Options parseOptions(int argc, char** argv, std::vector<char*>& rest)
{
    Options o;
    rest.push_back(argv[0]);
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--smoke")
            o.smoke = true;
        else if (arg == "--out" && i + 1 < argc)
            o.out = argv[++i];
        else if (arg == "--collector" && i + 1 < argc)
            o.collector = argv[++i];
        else if (arg == "--tables" && i + 1 < argc)
            o.tables = std::strtol(argv[++i], nullptr, 10);
        else {
            o.filtered = o.filtered || arg.rfind("--benchmark_filter", 0) == 0;
            rest.push_back(argv[i]);
        }
    }
    return o;
}

}  // namespace
}  // namespace wq5bench

int main(int argc, char** argv)
{
    using namespace wq5bench;
    std::vector<char*> args;
    const Options options = parseOptions(argc, argv, args);

    // The record path traces as the collector does by default (errors,
    // flow, info), into a file of the run: what part F's opens trace is
    // part of their cost.
    TempDir traceDir("trace");
    const std::string traceFile = traceDir.path() + "/trace.log";
    setenv("MOQ_TRACE_FILE", traceFile.c_str(), 1);
    unsetenv("MOQ_TRACE");

    // Repetitions of all measurements are interleaved, so that a slow
    // moment of the shared machine does not fall on one part only.
    static char interleave[] = "--benchmark_enable_random_interleaving=true";
    if (!options.smoke)
        args.insert(args.begin() + 1, interleave);
    int count = static_cast<int>(args.size());
    benchmark::Initialize(&count, args.data());
    if (benchmark::ReportUnrecognizedArguments(count, args.data()))
        return 2;

    const std::string loadBefore = loadAverage();
    registerRecordPath(options.smoke ? 0.05 : 0.5, options.smoke ? 1 : 5);
    TableReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();

    Table table(reporter.results);
    addRecordPathRows(table);
    std::vector<std::string> failed = reporter.failed;
    if (!options.filtered || options.tables > 0) {
        const long tables = options.tables > 0 ? options.tables : options.smoke ? 100 : 5000;
        std::cerr << "G: the collector process over " << tables << " and " << tables * 10 << " tables\n";
        const ProcessRun small = runWholeProcess(options.collector, tables);
        const ProcessRun large = runWholeProcess(options.collector, tables * 10);
        addProcessRows(table, small, large);
        for (const ProcessRun* run : {&small, &large})
            if (!run->complete)
                failed.push_back("G, " + std::to_string(run->tables) + " tables: " + run->problem);
    }

    std::ostringstream report;
    report << "Run " << timestamp() << (options.smoke ? " (smoke: numbers mean nothing)" : "") << ", "
           << RECORDS_PER_TABLE << " records per table (one page, nine objects)\n\n"
           << machine() << "- Load average (1, 5, 15 min) before the run: " << loadBefore
           << "; after: " << loadAverage() << "\n\n"
           << table.markdown() << "\n"
           << "records/s: A to D and F per CPU second of the measuring thread (the median of interleaved\n"
           << "repetitions), E and G per second of wall-clock time. MB/s: millions of record bytes.\n";
    std::cout << "\n" << report.str();
    std::ofstream out(options.out);
    out << report.str();
    if (!out) {
        std::cerr << "wq5bench: cannot write " << options.out << "\n";
        return 1;
    }
    // A part that could not run is a broken benchmark; slow numbers never
    // are.
    for (const std::string& failure : failed)
        std::cerr << "wq5bench: failed: " << failure << "\n";
    return failed.empty() ? 0 : 1;
}
