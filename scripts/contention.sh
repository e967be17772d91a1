#!/usr/bin/env bash
# Four writers and two readers drive fileindexctl at once in a sandbox for SECONDS (default
# 30), then report refusals (a write not made), false failures (a write reported as failed
# that was made) and the latency of the writes.
#   contention.sh [SECONDS] [BUILD_DIR] [GLOBAL OPTIONS...]   (e.g. --wait 0 for fail-fast)
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-30}
build=${2:-build}
shift $(($# > 2 ? 2 : $#))
ctl=$PWD/$build/tools/fileindexctl/fileindexctl
work=$(mktemp -d /tmp/fileindex-contention.XXXXXX)
root=$work/root
trap '"$ctl" --sysroot "$root" sandbox stop >/dev/null 2>&1 || true; rm -rf "$work"' EXIT
"$ctl" sandbox init "$root" >/dev/null
"$ctl" --sysroot "$root" --no-syslog folders add /video/movies >/dev/null  # keeps the daemon up

now() { date +%s%N; }
writer() {
  local i=$1 end=$2 n=0 folder=/photo/w$1 args status start applied present=0
  shift 2
  mkdir -p "$root/volume1/photo/w$i"
  while (($(now) < end)); do
    case $((n % 4)) in
      0) args=(folders add "$folder") ;;
      1) args=(pause 1) ;;
      2) args=(folders remove "$folder") ;;
      3) args=(resume) ;;
    esac
    start=$(now)
    status=0
    "$ctl" --sysroot "$root" --no-syslog "$@" "${args[@]}" >/dev/null 2>"$work/err$i" || status=$?
    applied=-
    if ((status == 0)); then
      case ${args[1]:-} in add) present=1 ;; remove) present=0 ;; esac
    else
      # Was the change made although it was reported as failed?
      local now_present=0
      "$ctl" --sysroot "$root" --no-syslog path indexed "$folder" >/dev/null 2>&1 && now_present=1
      case ${args[1]:-} in
        add) ((!present && now_present)) && applied=yes || applied=no ;;
        remove) ((present && !now_present)) && applied=yes || applied=no ;;
      esac
      present=$now_present
    fi
    echo "w $(((($(now) - start)) / 1000000)) $status $applied ${args[*]}"
    n=$((n + 1))
  done >"$work/log$i"
}
reader() {
  local i=$1 end=$2 status start
  while (($(now) < end)); do
    start=$(now)
    status=0
    if ((i % 2)); then
      "$ctl" --sysroot "$root" --no-syslog folders list >/dev/null 2>&1 || status=$?
    else
      "$ctl" --sysroot "$root" --no-syslog status >/dev/null 2>&1 || status=$?
    fi
    echo "r $(((($(now) - start)) / 1000000)) $status - read"
  done >"$work/log$i"
}

end=$(($(now) + seconds * 1000000000))
for i in 1 2 3 4; do writer "$i" "$end" "$@" & done
for i in 5 6; do reader "$i" "$end" & done
wait

cat "$work"/log* | awk '
  $1 == "w" { writes++; if ($3 != 0) { failed++; if ($4 == "yes") falsefail++; else refused++ } }
  $1 == "r" { reads++; if ($3 != 0) readfail++ }
  END {
    printf "writes %d (failed %d: refused %d, false failures %d), reads %d (failed %d)\n",
           writes, failed, refused + 0, falsefail + 0, reads, readfail + 0
  }'
awk '$1 == "w" { print $2 }' "$work"/log* | sort -n | awk '
  { lat[NR] = $1 }
  END { printf "write latency: p50 %d ms, p95 %d ms, max %d ms\n", lat[int((NR + 1) * 0.50)], lat[int((NR + 1) * 0.95)], lat[NR] }'
awk '$3 != 0' "$work"/log* | head -5
