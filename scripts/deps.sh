#!/usr/bin/env bash
# Installs the Debian packages that a job needs, when any is missing:
#
#   scripts/deps.sh PURPOSE...
#
# PURPOSE is one or more of:
#   build  compile the library, the tool and the daemons, and make the man
#          pages (every other purpose includes it)
#   demo   what scripts/demo.sh runs besides the programs
#   test   the test suite: GoogleTest, the fixture makers and oracles, and
#          the tools the install and CLI tests call
#   bench  Google Benchmark and the programs measured against
#   fuzz   clang with libFuzzer and the sanitizer runtimes
#
# Needs root (or sudo) only to install; without either it prints the
# apt-get line to run.
set -euo pipefail

# The media parser builds on FFmpeg's libraries, TagLib, exiv2 and libblkid,
# the thumbnail daemon on libvips. Media and photos for the demo, the tests
# and the fuzzers' seeds are made on the spot with ffmpeg, exiftool and the
# vips command (the tests also use ffprobe and exiftool as
# oracles); the benchmarks compare with ffprobe, MiniDLNA, vipsthumbnail and
# ImageMagick's convert.
build=(cmake make g++ pkg-config libjsoncpp-dev libevent-dev libicu-dev
       help2man libavformat-dev libavcodec-dev libavutil-dev libtag1-dev
       libexiv2-dev libblkid-dev libvips-dev)
media=(python3 ffmpeg libimage-exiftool-perl libvips-tools)
demo=("${media[@]}")
test=("${media[@]}" libgtest-dev libgmock-dev man-db systemd clang-format)
bench=("${media[@]}" libbenchmark-dev strace time minidlna imagemagick)
fuzz=("${media[@]}" clang libclang-rt-14-dev)

[ $# -ge 1 ] || set -- build
packages=("${build[@]}")
for purpose in "$@"; do
  case $purpose in
    build) ;;
    demo) packages+=("${demo[@]}") ;;
    test) packages+=("${test[@]}") ;;
    bench) packages+=("${bench[@]}") ;;
    fuzz) packages+=("${fuzz[@]}") ;;
    *) echo "deps.sh: unknown purpose '$purpose' (build, demo, test, bench, fuzz)" >&2
       exit 2 ;;
  esac
done

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" \
    || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0
echo "Installing: ${missing[*]}"
if [ "$(id -u)" -eq 0 ]; then
  sudo=""
elif command -v sudo >/dev/null 2>&1; then
  sudo="sudo"
else
  echo "Missing packages and no root: run 'apt-get install ${missing[*]}' as root." >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
