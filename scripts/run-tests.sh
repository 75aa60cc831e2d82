#!/usr/bin/env bash
# Sets everything up and runs the tests: the suite built with g++, the build
# with clang, and the suite again under AddressSanitizer +
# UndefinedBehaviorSanitizer and under ThreadSanitizer.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh

run_suite() {
  local flavour=$1
  echo "== tests ($flavour)"
  ctest --test-dir "build/$flavour" -j "$(nproc)" --output-on-failure --timeout 600
}

bash scripts/build.sh gcc
run_suite gcc

echo "== build (clang)"
bash scripts/build.sh clang

bash scripts/build.sh asan
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1 run_suite asan

# Frames are judged by several threads at once; the host's locks are real.
bash scripts/build.sh tsan
TSAN_OPTIONS=halt_on_error=1 run_suite tsan

# Fuzz targets, a bounded time each (libFuzzer with clang, ASan and UBSan).
bash scripts/fuzz.sh 30
