#!/usr/bin/env bash
# Builds the benchmarks in Release and runs them: every measured path beside its naive
# baseline, then the peak memory of a scan over a 1 GB queue, then the service end to end
# (the real daemons on a generated tree, and searches over a million entries; SERVICE=0
# skips it, SERVICE_ARGS passes it options such as "--files 20000 --dirs 2000").
# Arguments are passed to the benchmark program (for example --benchmark_filter=queue_scan).
# The machine's load is printed before and after: figures taken on a busy machine are
# not comparable.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh
BUILD_DIR=${BUILD_DIR:-build-bench}
RSS_MEGABYTES=${RSS_MEGABYTES:-1024}

SERVICE=${SERVICE:-1}
SERVICE_ARGS=${SERVICE_ARGS:-}

cmake -S . -B "$BUILD_DIR" -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_BENCH=ON -DFILEINDEX_TESTS=OFF >/dev/null
targets=(fileindex_bench fileindex_queue_rss)
[ "$SERVICE" = 0 ] || targets+=(fileindex_bench_service fileindexctl fileindexd fileindex-extract tavotifyd)
cmake --build "$BUILD_DIR" -j2 --target "${targets[@]}" >/dev/null

echo "load before: $(uptime)"
"$BUILD_DIR/bench/fileindex_bench" "$@"
echo
echo "peak memory of a folder status over a ${RSS_MEGABYTES} MB queue:"
"$BUILD_DIR/bench/fileindex_queue_rss" "$RSS_MEGABYTES"
if [ "$SERVICE" != 0 ]; then
  echo
  echo "the service end to end (a tmpfs is mounted for it when run as root, else /dev/shm is used):"
  # shellcheck disable=SC2086
  "$BUILD_DIR/bench/fileindex_bench_service" $SERVICE_ARGS
fi
echo "load after: $(uptime)"
