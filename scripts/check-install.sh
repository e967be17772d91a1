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
