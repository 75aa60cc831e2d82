#!/usr/bin/env bash
# Sets everything up and runs the tests: the suite built with g++, then again
# built with clang under AddressSanitizer + UndefinedBehaviorSanitizer and
# under ThreadSanitizer (both with clang's warnings as errors, so no plain
# clang build is needed), and the fuzz targets from the ASan build.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh

passed=0
failed=0
run_suite() {
  local flavour=$1 log
  shift
  echo "== tests ($flavour) at ${SECONDS}s"
  log=$(mktemp)
  # set -e stops the run on a failure; the totals are for the closing line.
  ctest --test-dir "build/$flavour" -j "$(nproc)" --output-on-failure --timeout 600 "$@" | tee "$log"
  local total failures
  total=$(sed -n 's/.*tests failed out of \([0-9]*\).*/\1/p' "$log" | tail -n 1)
  failures=$(sed -n 's/.* \([0-9]*\) tests failed out of.*/\1/p' "$log" | tail -n 1)
  rm -f "$log"
  passed=$((passed + ${total:-0} - ${failures:-0}))
  failed=$((failed + ${failures:-0}))
}

bash scripts/build.sh gcc
run_suite gcc

bash scripts/build.sh asan
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1 run_suite asan

# Frames are judged by several threads at once; the host's locks are real.
# Only the programs whose tests run threads (the host's locks and timer
# thread, the module judged from several threads, the control server, the
# fast path's attach) are built a third time: the others run single-threaded
# on virtual time, which ThreadSanitizer has nothing to say about.
threaded=(host module live fastpath)
programs=()
for suite in "${threaded[@]}"; do programs+=("swsec_${suite}_tests"); done
bash scripts/build.sh tsan swsec_module "${programs[@]}"
TSAN_OPTIONS=halt_on_error=1 run_suite tsan -L "^($(IFS='|'; echo "${threaded[*]}"))\$"

# Fuzz targets, a bounded time each (libFuzzer, in the ASan build).
bash scripts/fuzz.sh 30

echo "tests: $passed passed, $failed failed (${SECONDS}s)"
