#!/usr/bin/env bash
# Installs the build tree into a temporary prefix and builds a program
# against it twice: with pkg-config alone, and with find_package(quvaidx).
set -euo pipefail
build_dir=$1
source_dir=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d /tmp/quvaidx-install-XXXXXX)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix

cmake --install "$build_dir" --prefix "$prefix" >/dev/null
libdir=$(ls -d "$prefix"/lib*/pkgconfig | head -n1)
libdir=${libdir%/pkgconfig}
test -f "$prefix/include/quvaidx/quvaidx.h"
readelf -d "$libdir/libquvaidx.so" | grep -q 'SONAME.*libquvaidx\.so\.[0-9]'
test -f "$libdir/libquvaidx.a"

export PKG_CONFIG_PATH=$libdir/pkgconfig
# shellcheck disable=SC2046
c++ -std=c++17 -o "$work/consumer_pc" "$source_dir/consumer.cc" \
    $(pkg-config --cflags --libs quvaidx)
LD_LIBRARY_PATH=$libdir "$work/consumer_pc"

mkdir "$work/cmake-consumer"
cp "$source_dir/consumer.cc" "$work/cmake-consumer/"
cp "$source_dir/CMakeLists.txt.in" "$work/cmake-consumer/CMakeLists.txt"
cmake -S "$work/cmake-consumer" -B "$work/cmake-build" \
      -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
LD_LIBRARY_PATH=$libdir "$work/cmake-build/consumer"
echo "install check passed"
