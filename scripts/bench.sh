#!/usr/bin/env bash
# Builds the benchmark (Release, build-bench/) and runs all of it: the
# collector's record path against one flushed write per record, spdlog,
# formatting alone, several threads, rollover, and the whole collector
# process. Prints the table and writes it to bench/results.md (see
# BENCHMARKS.md). About four minutes; run it on an otherwise idle machine.
#
#   scripts/bench.sh            the full run
#   scripts/bench.sh --smoke    every part briefly (CI: it keeps working; the
#                               numbers mean nothing), table to
#                               build-bench/results-smoke.md
# Further arguments go to the benchmark (see bench/main.cpp).
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
scripts/build.sh build-bench -DCMAKE_BUILD_TYPE=Release >/dev/null

out=bench/results.md
for arg in "$@"; do
  [ "$arg" = --smoke ] && out=build-bench/results-smoke.md
done
exec build-bench/wq5bench --out "$out" "$@"
