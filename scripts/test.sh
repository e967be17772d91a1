#!/usr/bin/env bash
# Installs the dependencies, configures, builds and runs the whole test suite, then the
# same suite again built with AddressSanitizer and UndefinedBehaviorSanitizer, then each
# libFuzzer target for a short bounded time (FILEINDEX_FUZZ_SECONDS each).
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh
BUILD_DIR=${BUILD_DIR:-build}
jobs=$(nproc)
# The benchmarks are built too (not run), so that a change to what they share with the
# tests cannot leave them behind.
cmake -S . -B "$BUILD_DIR" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DFILEINDEX_BENCH=ON
cmake --build "$BUILD_DIR" -j"$jobs"
ctest --test-dir "$BUILD_DIR" --output-on-failure -j"$jobs"

if [ "${FILEINDEX_SKIP_SANITIZERS:-0}" != 1 ]; then
  cmake -S . -B "$BUILD_DIR-sanitize" -DCMAKE_BUILD_TYPE=Debug -DFILEINDEX_SANITIZE=ON
  cmake --build "$BUILD_DIR-sanitize" -j"$jobs"
  ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    ctest --test-dir "$BUILD_DIR-sanitize" --output-on-failure -j"$jobs"
fi

if [ "${FILEINDEX_SKIP_FUZZ:-0}" != 1 ]; then
  BUILD_DIR="$BUILD_DIR-fuzz" bash scripts/fuzz.sh "${FILEINDEX_FUZZ_SECONDS:-20}"
fi
