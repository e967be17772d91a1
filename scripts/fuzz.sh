#!/usr/bin/env bash
# Builds the libFuzzer targets with clang and runs each for a bounded time.
#   scripts/fuzz.sh [seconds-per-target] [target...]
# The seed corpora in fuzz/corpus/<target> are only read; what a run discovers goes to
# $BUILD_DIR/corpus/<target>, and crash inputs to $BUILD_DIR/artifacts/<target>/.
set -euo pipefail
cd "$(dirname "$0")/.."
SECONDS_PER_TARGET=${1:-60}
shift || true
BUILD_DIR=${BUILD_DIR:-build-fuzz}
CLANG_VERSION=${CLANG_VERSION:-14}
TARGETS=("$@")
if ((${#TARGETS[@]} == 0)); then
  TARGETS=(fuzz_queue_line fuzz_folders_load fuzz_folder_conf fuzz_status fuzz_index_mgr fuzz_query_string)
fi

cmake -S . -B "$BUILD_DIR" -DFILEINDEX_FUZZ=ON -DFILEINDEX_TESTS=OFF -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_C_COMPILER="clang-$CLANG_VERSION" -DCMAKE_CXX_COMPILER="clang++-$CLANG_VERSION" >/dev/null
cmake --build "$BUILD_DIR" --target "${TARGETS[@]}" -j"$(nproc)"

status=0
passed=0
failed=0
for target in "${TARGETS[@]}"; do
  work="$BUILD_DIR/corpus/$target"
  artifacts="$BUILD_DIR/artifacts/$target/"
  mkdir -p "$work" "$artifacts"
  log="$BUILD_DIR/$target.log"
  echo "== $target: ${SECONDS_PER_TARGET}s"
  if ! "$BUILD_DIR/fuzz/$target" -max_total_time="$SECONDS_PER_TARGET" -max_len=8192 -timeout=20 \
      -rss_limit_mb=4096 -print_final_stats=1 -artifact_prefix="$artifacts" \
      "$work" "fuzz/corpus/$target" >"$log" 2>&1; then
    status=1
    failed=$((failed + 1))
    echo "   FAILED; see $log and $artifacts"
    grep -m3 -E '==fileindex fuzz==|ERROR: (AddressSanitizer|libFuzzer|UndefinedBehaviorSanitizer)|runtime error' \
      "$log" || true
  fi
  grep -E '^#[0-9]+[[:space:]]+DONE' "$log" || tail -n 3 "$log"
  grep -E '^stat::number_of_executed_units' "$log" || true
done
passed=$((${#TARGETS[@]} - failed))
echo "fuzz: $passed passed, $failed failed"
exit $status
