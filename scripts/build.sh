#!/usr/bin/env bash
# Configures and builds one flavour of the tree into build/<flavour>.
#   gcc      g++, warnings as errors (the default)
#   clang    clang++, warnings as errors
#   asan     clang++ with AddressSanitizer and UndefinedBehaviorSanitizer, and
#            coverage for libFuzzer: the tests and the fuzz targets in one build
#   tsan     clang++ with ThreadSanitizer
#   release  g++ optimised with link-time optimisation, for the tools and
#            benchmarks (their host without the test-only checks)
#   profile  the release flavour for x86-64-v3, which valgrind can run
#            (it rejects AVX-512): bench/instructions.sh counts with it
# Further arguments name the targets to build (default: all).
set -euo pipefail
cd "$(dirname "$0")/.."

flavour=${1:-gcc}
shift || true
args=(-G Ninja -DSWSEC_WERROR=ON)
case "$flavour" in
  gcc)     args+=(-DCMAKE_CXX_COMPILER=g++ -DCMAKE_C_COMPILER=gcc -DCMAKE_BUILD_TYPE=RelWithDebInfo) ;;
  clang)   args+=(-DCMAKE_CXX_COMPILER=clang++ -DCMAKE_C_COMPILER=clang -DCMAKE_BUILD_TYPE=RelWithDebInfo) ;;
  asan)    args+=(-DCMAKE_CXX_COMPILER=clang++ -DCMAKE_C_COMPILER=clang -DCMAKE_BUILD_TYPE=RelWithDebInfo
                  -DSWSEC_FUZZ=ON) ;;
  tsan)    args+=(-DCMAKE_CXX_COMPILER=clang++ -DCMAKE_C_COMPILER=clang -DCMAKE_BUILD_TYPE=RelWithDebInfo
                  -DSWSEC_SANITIZE=thread) ;;
  release) args+=(-DCMAKE_CXX_COMPILER=g++ -DCMAKE_C_COMPILER=gcc -DCMAKE_BUILD_TYPE=Release -DSWSEC_LTO=ON -DSWSEC_LEAN_HOST=ON) ;;
  profile) args+=(-DCMAKE_CXX_COMPILER=g++ -DCMAKE_C_COMPILER=gcc -DCMAKE_BUILD_TYPE=Release -DSWSEC_LTO=ON
                  -DSWSEC_LEAN_HOST=ON -DSWSEC_MARCH=x86-64-v3) ;;
  *) echo "build: unknown flavour '$flavour' (gcc, clang, asan, tsan, release, profile)" >&2; exit 2 ;;
esac

# A compiler cache, where one is installed, makes rebuilds in several checkouts cheap.
if command -v ccache >/dev/null; then args+=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache); fi

dir="build/$flavour"
cmake -S . -B "$dir" "${args[@]}" >/dev/null
ninja -C "$dir" -j "$(nproc)" "$@"
