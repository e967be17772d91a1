#!/usr/bin/env bash
# Builds the benchmarks in Release and runs them: every measured path beside its naive
# baseline, then the peak memory of a scan over a 1 GB queue. Arguments are passed to
# the benchmark program (for example --benchmark_filter=queue_scan).
# The machine's load is printed before and after: figures taken on a busy machine are
# not comparable.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh
BUILD_DIR=${BUILD_DIR:-build-bench}
RSS_MEGABYTES=${RSS_MEGABYTES:-1024}

cmake -S . -B "$BUILD_DIR" -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_BENCH=ON -DFILEINDEX_TESTS=OFF >/dev/null
cmake --build "$BUILD_DIR" -j2 --target fileindex_bench fileindex_queue_rss >/dev/null

echo "load before: $(uptime)"
"$BUILD_DIR/bench/fileindex_bench" "$@"
echo
echo "peak memory of a folder status over a ${RSS_MEGABYTES} MB queue:"
"$BUILD_DIR/bench/fileindex_queue_rss" "$RSS_MEGABYTES"
echo "load after: $(uptime)"
