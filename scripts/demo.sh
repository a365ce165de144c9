#!/usr/bin/env bash
# The collector's main job on a bundled default: builds the collector, runs
# it with every traffic kind switched on while our collection library
# replays the browser capture samples/demo.har, stops it with SIGTERM once
# every table has been delivered and given back, and shows what it wrote.
#
#   scripts/demo.sh [capture.har | table-script.jsonl]
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
# Only what the main job runs: the collector and its two libraries.
cmake -S . -B build -G Ninja >/dev/null
ninja -C build wq5collector >/dev/null

replay=$(realpath "${1:-samples/demo.har}")
run=$PWD/demo-run
rm -rf "$run"
mkdir -p "$run/log"

export WQ5_WORK_PATH=$run
export WQ5_COLLECTOR_ID=${WQ5_COLLECTOR_ID:-demo}
for kind in HTTP HTTPOBJ HTTPS MS_VIDEO MS_AUDIO REAL_VIDEO REAL_AUDIO QUICKTIME; do
  export "WQ5_LOG_$kind=Y"
done
export ZUB1_REPLAY=$replay
export ZUB1_STATUS_FILE=$run/status.json
# One delivery thread: tables arrive in capture order, so that every object
# record carries the GUID of its own page.
export ZUB1_THREADS=1
export ZUB1_LOOPS=1 ZUB1_RATE=0
export MOQ_TRACE=${MOQ_TRACE:-all}
export MOQ_TRACE_FILE=$run/trace.log

build/wq5collector &
pid=$!
# The library writes the status file once the whole capture is delivered
# and every table has been given back.
for _ in $(seq 1 600); do
  [ -s "$run/status.json" ] && break
  kill -0 "$pid" 2>/dev/null || break
  sleep 0.1
done
kill -TERM "$pid" 2>/dev/null || true
status=0
wait "$pid" || status=$?

echo "Collector exit status: $status"
echo "Replay status: $(cat "$run/status.json" 2>/dev/null || echo 'not written')"
echo "Trace: $run/trace.log ($(wc -l <"$run/trace.log") lines)"
shopt -s nullglob
files=("$run"/log/*.wq5)
if ((${#files[@]} == 0)); then
  echo "No log file was written."
else
  for f in "${files[@]}"; do
    echo "Log file: $f"
    for tag in hpage hobj video audio; do
      printf '  %-6s %d records\n' "$tag" "$(grep -c "^<$tag>" "$f" || true)"
    done
  done
  echo "First lines:"
  head -n 3 "${files[0]}" | cut -c1-200
fi
exit "$status"
