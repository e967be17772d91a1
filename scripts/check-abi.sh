#!/usr/bin/env bash
# Compares the library's binary interface with the committed baseline abi/libfileindex.abi
# (libabigail). Added interfaces are compatible; anything incompatible fails.
#   check-abi.sh LIBRARY BASELINE [--update]
set -euo pipefail
lib=$1 baseline=$2
headers=$(cd "$(dirname "$0")/.." && pwd)/include/fileindex
if [ "${3:-}" = "--update" ]; then
  abidw --headers-dir "$headers" --out-file "$baseline" "$lib"
  echo "updated $baseline"
  exit 0
fi
set +e
abidiff --headers-dir2 "$headers" "$baseline" "$lib"
rc=$?
set -e
# abidiff's exit status is a bit field: 1 error, 2 usage, 4 ABI change, 8 incompatible.
if (( rc & 1 || rc & 2 || rc & 8 )); then
  echo "incompatible ABI change (abidiff status $rc): update abi/ in the same commit if intended" >&2
  exit 1
fi
echo "1 passed, 0 failed (abidiff status $rc)"
