#!/usr/bin/env bash
# Installs the build tree into a temporary prefix and checks that what was
# installed works there as it is, with no environment set: the tool and the
# daemons start, programs built with pkg-config alone and with
# find_package(quvaidx) (shared and static) run, every part reports the
# same version, the man pages open, the completion and the systemd units
# are in place (a socket unit for each daemon that listens, at its own
# path; all verify, where systemd-analyze is available), and
# uninstall takes everything away again.
#
#   check_install.sh BUILD_DIR VERSION
set -euo pipefail
build_dir=$1
version=$2
source_dir=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d /tmp/quvaidx-install-XXXXXX)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix
unset LD_LIBRARY_PATH

fail() { echo "install check: $*" >&2; exit 1; }
same_version() { [ "$2" = "$version" ] || fail "$1 reports '$2', not $version"; }

cmake --install "$build_dir" --prefix "$prefix" >"$work/install.log"
libdir=$(dirname "$(find "$prefix" -name libquvaidx.so -print -quit)")
test -f "$prefix/include/quvaidx/quvaidx.h" || fail "no headers"
test -f "$libdir/libquvaidx.a" || fail "no static library"
readelf -d "$libdir/libquvaidx.so" | grep -q 'SONAME.*libquvaidx\.so\.[0-9]' ||
  fail "no SONAME"

# The installed programs, straight from the prefix.
same_version "quvaidx --version" "$("$prefix/bin/quvaidx" --version | sed 's/^quvaidx //')"
daemons=()
for daemon in "$prefix"/sbin/*; do
  name=$(basename "$daemon")
  daemons+=("$name")
  same_version "$name --version" "$("$daemon" --version | sed "s/^$name //")"
done
[ ${#daemons[@]} -gt 0 ] || fail "no daemon in sbin/"

# A consumer built with pkg-config alone.
export PKG_CONFIG_PATH=$libdir/pkgconfig
same_version "quvaidx.pc" "$(pkg-config --modversion quvaidx)"
# shellcheck disable=SC2046
c++ -std=c++17 -o "$work/consumer_pc" "$source_dir/consumer.cc" \
  $(pkg-config --cflags --libs quvaidx)
same_version "QuvaidxVersion (pkg-config)" "$("$work/consumer_pc")"

# Consumers built with find_package, against the shared and static library.
mkdir "$work/cmake-consumer"
cp "$source_dir/consumer.cc" "$work/cmake-consumer/"
cp "$source_dir/CMakeLists.txt.in" "$work/cmake-consumer/CMakeLists.txt"
cmake -S "$work/cmake-consumer" -B "$work/cmake-build" \
  -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
same_version "the CMake package" "$(cat "$work/cmake-build/package_version")"
same_version "QuvaidxVersion (find_package)" "$("$work/cmake-build/consumer")"
same_version "QuvaidxVersion (static)" "$("$work/cmake-build/consumer_static")"
readelf -d "$work/cmake-build/consumer_static" | grep -q libquvaidx &&
  fail "the static consumer needs libquvaidx.so"

# Man pages, completion, units.
if [ -d "$prefix/share/man" ]; then
  pages=(man1/quvaidx.1 man1/quvaidx-send.1)
  for name in "${daemons[@]}"; do pages+=("man8/$name.8"); done
  for page in "${pages[@]}"; do
    test -f "$prefix/share/man/$page" || fail "no man page $page"
  done
  for page in "$prefix"/share/man/man*/*; do
    MANWIDTH=80 man -l "$page" 2>/dev/null | grep -q -- '--help' ||
      fail "$page does not open, or lists no options"
  done
fi
test -f "$prefix/share/bash-completion/completions/quvaidx" || fail "no completion"
units=$prefix/lib/systemd/system
for name in "${daemons[@]}"; do
  unit=$units/$name.service
  test -f "$unit" || fail "no unit $unit"
  grep -qx "ExecStart=$prefix/sbin/$name --foreground" "$unit" ||
    fail "$unit does not start $prefix/sbin/$name"
  # A daemon that listens has its socket bound by the service manager, at
  # the path the daemon itself would take.
  socket=$("$prefix/sbin/$name" --help | grep -A1 -- '--socket PATH' |
    sed -n 's/^ *(default \(\/.*\))$/\1/p' || true)
  if [ -n "$socket" ]; then
    grep -qx "ListenStream=$socket" "$units/$name.socket" ||
      fail "$name has no socket unit for $socket"
    grep -qx "Requires=$name.socket" "$unit" || fail "$unit does not require its socket"
  fi
done
if command -v systemd-analyze >/dev/null; then
  # The units name their man pages, which a build without docs lacks.
  man_check=()
  [ -d "$prefix/share/man" ] || man_check=(--man=no)
  MANPATH=$prefix/share/man: systemd-analyze verify "${man_check[@]}" \
    "$units"/*.service "$units"/*.socket || fail "a unit does not verify"
fi

# Uninstall leaves no file behind.
cmake --build "$build_dir" --target uninstall >/dev/null
left=$(find "$prefix" ! -type d)
[ -z "$left" ] || fail "uninstall left: $left"
echo "install check passed: version $version, daemons ${daemons[*]}"
