#!/usr/bin/env bash
# Installs a build into a temporary prefix and builds consumers against the install
# tree: a C99 program and a C++ program through pkg-config, and the C++ program again
# through find_package(FileIndex).
#   check-install.sh BUILD_DIR
set -euo pipefail
build=$(cd "$1" && pwd)
src=$(cd "$(dirname "$0")/.." && pwd)/tests/install
work=$(mktemp -d /tmp/fileindex-install-XXXXXX)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix
cmake --install "$build" --prefix "$prefix" >/dev/null
libdir=$prefix/lib
[ -d "$libdir/pkgconfig" ] || libdir=$(dirname "$(find "$prefix" -name fileindex.pc | head -1)")/..
test -L "$libdir/libfileindex.so"
readelf -d "$libdir/libfileindex.so.6.0" | grep -q 'SONAME.*\[libfileindex.so.6.0\]'
for f in fileindex/fileindex.h fileindex/fileindex_c.h tavo/platform.h tavo/tavotifyd.h; do
  test -f "$prefix/include/$f"
done
# The tool's manual page and bash completion; the completion offers commands, share names
# from a sandbox's share table and configured folders.
grep -q '^\.TH FILEINDEXCTL 1' "$prefix/share/man/man1/fileindexctl.1"
completion=$prefix/share/bash-completion/completions/fileindexctl
LD_LIBRARY_PATH=$libdir "$prefix/bin/fileindexctl" sandbox init "$work/sandbox" >/dev/null
mkdir "$work/sandbox/volume1/photo/my folder"
LD_LIBRARY_PATH=$libdir "$prefix/bin/fileindexctl" --sysroot "$work/sandbox" folders add "/photo/my folder" >/dev/null
complete_words() {
  LD_LIBRARY_PATH=$libdir bash -c 'source "$1"; shift; COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1))
    _fileindexctl; printf "%s\n" "${COMPREPLY[@]}"' _ "$completion" "$prefix/bin/fileindexctl" "$@"
}
complete_words fol | grep -qx folders
complete_words --sysroot "$work/sandbox" share pause p | grep -qx photo
complete_words --sysroot "$work/sandbox" folders remove /ph | grep -qx "/photo/my folder"
complete_words folders add --fo | grep -qx -- --force
LD_LIBRARY_PATH=$libdir "$prefix/bin/fileindexctl" --sysroot "$work/sandbox" sandbox stop >/dev/null

export PKG_CONFIG_PATH=$libdir/pkgconfig
export LD_LIBRARY_PATH=$libdir
export FILEINDEX_SYSROOT=$work/root
mkdir -p "$FILEINDEX_SYSROOT"
cc -std=c99 -pedantic-errors -Wall -Wextra -Werror -o "$work/c_consumer" "$src/consumer.c" \
  $(pkg-config --cflags --libs fileindex)
"$work/c_consumer"
c++ -std=c++17 -Wall -Wextra -Werror -o "$work/cxx_consumer" "$src/consumer.cpp" \
  $(pkg-config --cflags --libs fileindex)
"$work/cxx_consumer"
cmake -S "$src" -B "$work/cmake-build" -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
"$work/cmake-build/consumer"
