#!/usr/bin/env bash
# Compares the library's exported dynamic symbols (demangled) with the reviewed list in
# abi/exported-symbols.txt. Weak definitions of inline functions depend on the build's
# optimisation level and are not part of the list.
#   check-exports.sh LIBRARY LIST [--update]
set -euo pipefail
lib=$1 list=$2
current=$(nm -DC --defined-only "$lib" | awk '$2 != "W" { $1 = ""; $2 = ""; sub(/^ +/, ""); print }' | LC_ALL=C sort)
if [ "${3:-}" = "--update" ]; then
  printf '%s\n' "$current" > "$list"
  echo "updated $list ($(wc -l < "$list") symbols)"
  exit 0
fi
if ! diff -u "$list" <(printf '%s\n' "$current"); then
  echo "the exported interface changed: review the diff and run $0 $lib $list --update" >&2
  exit 1
fi
echo "1 passed, 0 failed ($(wc -l < "$list") exported symbols as reviewed)"
