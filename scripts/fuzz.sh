#!/usr/bin/env bash
# scripts/fuzz.sh [SECONDS] [TARGET...]: builds the libFuzzer targets with
# clang, AddressSanitizer and UndefinedBehaviorSanitizer into build-fuzz/
# and runs each (default: all of fuzz/*_fuzz.cpp) for SECONDS (default 600)
# at the lowest priority. New interesting inputs are merged into
# fuzz/corpus/<target>/, kept at CORPUS_CAP files (default 50) or fewer. A
# crash stops the run and leaves its input in build-fuzz/artifacts/<target>/;
# once fixed, copy it to fuzz/crashes/<target>/ so that ctest replays it.
# The run's log is build-fuzz/logs/<target>.log; its final statistics are
# printed.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-600}
shift || true
cap=${CORPUS_CAP:-50}
if (($# == 0)); then
  set -- $(ls fuzz/*_fuzz.cpp | sed 's|fuzz/\(.*\)_fuzz.cpp|\1|')
fi

if ! command -v clang++ >/dev/null || ! ls /usr/lib/llvm-*/lib/clang/*/lib/linux/libclang_rt.fuzzer-x86_64.a >/dev/null 2>&1; then
  echo "fuzz.sh needs clang and its fuzzer runtime: apt-get install clang libclang-rt-14-dev" >&2
  exit 1
fi

CC=clang CXX=clang++ cmake -S . -B build-fuzz -G Ninja -DWQ5_FUZZ=ON -DWQ5_SANITIZE=address,undefined >/dev/null
ninja -C build-fuzz "${@/%/_fuzz}"

for target in "$@"; do
  fuzzer=build-fuzz/${target}_fuzz
  corpus=fuzz/corpus/$target
  work=build-fuzz/work/$target
  log=build-fuzz/logs/$target.log
  mkdir -p "$corpus" "$work" build-fuzz/artifacts/"$target" build-fuzz/logs
  echo "== $target: fuzzing for $seconds s (log: $log)"
  status=0
  nice -n 19 "$fuzzer" -max_total_time="$seconds" -timeout=10 -print_final_stats=1 \
    -artifact_prefix=build-fuzz/artifacts/"$target"/ "$work" "$corpus" >"$log" 2>&1 || status=$?
  grep -E '^#[0-9]+' "$log" | tail -1 || true
  grep -E '^Done [0-9]+ runs' "$log" || true
  if ((status != 0)); then
    echo "== $target: the fuzzer failed (exit $status); see $log and build-fuzz/artifacts/$target/" >&2
    exit "$status"
  fi

  # The corpus keeps at most $cap files: the inputs of the old corpus and of
  # this run chosen greedily, each adding the most coverage edges not yet
  # covered, until all are covered or the cap is reached.
  merged=build-fuzz/work/$target.merged
  control=build-fuzz/work/$target.control
  rm -rf "$merged" "$control" && mkdir -p "$merged"
  nice -n 19 "$fuzzer" -merge=1 -merge_control_file="$control" "$merged" "$corpus" "$work" >>"$log" 2>&1
  chosen=build-fuzz/work/$target.chosen
  rm -rf "$chosen" && mkdir -p "$chosen"
  python3 - "$control" "$cap" <<'PY' | while read -r file; do cp "$file" "$chosen"/; done
import os, sys
lines = open(sys.argv[1]).read().split("\n")
count = int(lines[0])
files = lines[2:2 + count]
edges = {int(l.split()[1]): set(l.split()[2:]) for l in lines[2 + count:] if l.startswith("COV ")}
# A file of the corpus may also be in the work directory under its name.
names = {}
for i in sorted(edges):
    names.setdefault(os.path.basename(files[i]), i)
edges = {i: edges[i] for i in names.values()}
everything = set().union(*edges.values()) if edges else set()
covered, chosen = set(), []
while len(chosen) < int(sys.argv[2]) and edges:
    best = max(edges, key=lambda i: (len(edges[i] - covered), -os.path.getsize(files[i])))
    if not edges[best] - covered:
        break
    covered |= edges.pop(best)
    chosen.append(files[best])
print("\n".join(chosen))
print(f"corpus keeps {len(covered)} of {len(everything)} edges", file=sys.stderr)
PY
  if [ -n "$(ls "$chosen")" ]; then
    rm -f "$corpus"/* && cp "$chosen"/* "$corpus"/
  fi
  echo "== $target: corpus now $(ls "$corpus" | wc -l) files"
done
