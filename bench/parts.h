// The parts of the benchmark and what main needs to know of them.
#ifndef WQ5_BENCH_PARTS_H
#define WQ5_BENCH_PARTS_H

#include <string>

namespace wq5bench {

// A size limit (MiB) that no run reaches: the record path then pays the
// status query of every record and never rolls over.
constexpr long UNREACHED_LIMIT_MB = 1L << 20;

// Older files of the current day in the directory of part F.
constexpr int OLDER_FILES = 1000;

// Parts A to F, registered with Google Benchmark. Each measurement runs
// for at least `minTime` seconds, `repetitions` times (interleaved with the
// others when the benchmark's random interleaving is on).
void registerRecordPath(double minTime, int repetitions);

// Part G: the collector process replaying tables as fast as it can.
struct ProcessRun {
    long tables = 0;
    double seconds = 0;        // from start until every table was given back
    double recordsPerSecond = 0;
    double megabytesPerSecond = 0;
    long peakKiB = 0;          // VmHWM
    long residentKiB = 0;      // VmRSS once every table was given back
    bool complete = false;     // every record reached the log
    std::string problem;       // why it is not complete
};
ProcessRun runWholeProcess(const std::string& collector, long tables);

}  // namespace wq5bench

#endif
