#!/usr/bin/env bash
# Builds everything and runs the whole test suite four times: a plain
# build (build/), AddressSanitizer with UndefinedBehaviorSanitizer
# (build-asan/), the concurrency tests under ThreadSanitizer (build-tsan/),
# and a 32-bit build (build-m32/, natively or under qemu-i386), with a
# short run of the benchmark. Exits non-zero when any test fails.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh

run_suite() {
  local dir=$1 label=$2
  shift 2
  echo "== $dir: build"
  scripts/build.sh "$dir" "$@"
  echo "== $dir: tests ${label:+(label $label)}"
  ctest --test-dir "$dir" --output-on-failure -j2 ${label:+-L "$label"}
}

export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1
export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
export TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1

run_suite build ""
# The benchmark is built with the plain suite and run briefly so that it
# keeps working; its numbers mean nothing here and are never judged.
echo "== benchmark smoke run"
build/wq5bench --smoke --out build/results-smoke.md >/dev/null
run_suite build-asan "" -DWQ5_SANITIZE=address,undefined -DWQ5_BENCH=OFF
run_suite build-tsan concurrency -DWQ5_SANITIZE=thread -DWQ5_BENCH=OFF
run_suite build-m32 "" -DCMAKE_TOOLCHAIN_FILE=cmake/m32.cmake -DWQ5_GTEST_FROM_SOURCE=ON -DWQ5_BENCH=OFF
echo "All test suites passed."
