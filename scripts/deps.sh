#!/usr/bin/env bash
# Installs the Debian packages that building, testing, benchmarking and
# fuzzing need, when any is missing. Needs root (or sudo) only to install.
set -euo pipefail
packages=(cmake make g++ clang libclang-rt-14-dev pkg-config libjsoncpp-dev
          libevent-dev libicu-dev libgtest-dev libgmock-dev libbenchmark-dev
          python3 strace time
          libavformat-dev libavcodec-dev libavutil-dev libtag1-dev libexiv2-dev libblkid-dev ffmpeg libimage-exiftool-perl minidlna)
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
