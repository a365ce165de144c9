#!/usr/bin/env bash
# Soak run (not in CI): the collector under a steady load for a chosen time,
# with a small size limit and one day of retention. Our collection library
# loops a capture at a fixed rate; at the end the collector is stopped with
# SIGTERM and every log file is checked with wq5check.
#
#   scripts/soak.sh [seconds=1800] [tables-per-second=50] [capture=samples/demo.har]
#
# Prints records per second, resident memory at the start and the end, the
# files kept and the checker's verdict; everything stays in soak-run/.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-1800}
rate=${2:-50}
capture=$(realpath "${3:-samples/demo.har}")
scripts/deps.sh
cmake -S . -B build -G Ninja >/dev/null
ninja -C build wq5collector wq5check >/dev/null

run=$PWD/soak-run
rm -rf "$run"
mkdir -p "$run/log"
for kind in HTTP HTTPOBJ HTTPS MS_VIDEO MS_AUDIO REAL_VIDEO REAL_AUDIO QUICKTIME; do
  export "WQ5_LOG_$kind=Y"
done
export WQ5_LOG_DIR=$run/log WQ5_LOG_MAX_SIZE_MB=1 WQ5_LOG_KEEPDAYS=1
export ZUB1_REPLAY=$capture ZUB1_LOOPS=0 ZUB1_RATE=$rate ZUB1_THREADS=4
export MOQ_TRACE=error,flow MOQ_TRACE_FILE=$run/trace.log

rss() { awk '/^VmRSS/ {print $2 " kB"}' "/proc/$1/status"; }

build/wq5collector &
pid=$!
sleep 10
rss_start=$(rss "$pid")
sleep $((seconds > 10 ? seconds - 10 : 0))
rss_end=$(rss "$pid")
hwm=$(awk '/^VmHWM/ {print $2 " kB"}' "/proc/$pid/status")
kill -TERM "$pid"
status=0
wait "$pid" || status=$?

verdict=0
build/wq5check "$run/log" >"$run/check.txt" 2>&1 || verdict=$?
records=$(cat "$run"/log/*.wq5 | grep -c '^<[a-z]*>' || true)
{
  echo "Soak run: ${seconds} s at ${rate} tables/s of $(basename "$capture"), 4 library threads, 1 MB limit, 1 day kept"
  echo "Collector exit status: $status"
  echo "Records: $records ($((records / seconds)) per second)"
  echo "Resident memory: ${rss_start} after 10 s, ${rss_end} at the end (peak ${hwm})"
  echo "Files kept: $(ls "$run/log" | wc -l)"
  echo "Checker (exit $verdict):"
  sed 's/^/  /' "$run/check.txt"
  echo "Errors traced: $(grep -c 'Error' "$run/trace.log" || true)"
} | tee "$run/summary.txt"
[ "$status" -eq 0 ] && [ "$verdict" -eq 0 ]
