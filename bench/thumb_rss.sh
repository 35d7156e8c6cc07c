#!/usr/bin/env bash
# Peak resident memory of the thumbnail daemon over a queue of 12-megapixel
# photos, against vipsthumbnail's peak for one photo, measured in one run.
#
#   bench/thumb_rss.sh BUILD_DIR
#
# Makes a 4000 x 3000 JPEG with the vips command (grey noise blurred a
# little, quality 90), then:
#   - vipsthumbnail PHOTO -s 1280, three times: its peak (GNU time's
#     maximum resident set size), the largest of the three;
#   - quvamkthumbd on a private queue holding one folder of N names of that
#     photo (hard links: each has its own thumbnails), N = 10 and 100: its
#     peak (VmHWM) once the queue is empty, and the time per photo.
# Goals: the daemon's peak over 100 photos at most 1.5 times vipsthumbnail's
# for one, and no growth from 10 photos to 100. Everything lives in one
# temporary directory, removed at exit; every wait is bounded.
set -uo pipefail

build=${1:-build-bench}
mkthumbd=$build/daemons/mkthumbd/quvamkthumbd
if [ ! -x "$mkthumbd" ]; then
  echo "thumb_rss.sh: $mkthumbd not found (build the daemons)" >&2
  exit 1
fi
for tool in vips vipsthumbnail; do
  if ! command -v "$tool" >/dev/null 2>&1; then
    echo "thumb_rss.sh: $tool not found (libvips-tools)" >&2
    exit 1
  fi
done
timer=/usr/bin/time
[ -x "$timer" ] || { echo "thumb_rss.sh: GNU time not found" >&2; exit 1; }

tmp=$(mktemp -d /tmp/quvaidx-thumb-rss.XXXXXX)
daemon_pid=""
cleanup() {
  if [ -n "$daemon_pid" ]; then
    kill -KILL "$daemon_pid" 2>/dev/null || true
    wait "$daemon_pid" 2>/dev/null || true
  fi
  rm -rf "$tmp"
}
trap cleanup EXIT

photo=$tmp/photo.jpg
for band in 0 1 2; do
  vips gaussnoise "$tmp/n$band.v" 4000 3000 --mean $((128 - 20 * band)) \
    --sigma 50 || exit 1
done
vips bandjoin "$tmp/n0.v $tmp/n1.v $tmp/n2.v" "$tmp/rgb.v" &&
  vips gaussblur "$tmp/rgb.v" "$tmp/blur.v" 1.5 &&
  vips cast "$tmp/blur.v" "$tmp/cast.v" uchar &&
  vips copy "$tmp/cast.v" "$tmp/srgb.v" --interpretation srgb &&
  vips jpegsave "$tmp/srgb.v" "$photo" --Q 90 || exit 1
rm -f "$tmp"/*.v

echo "== Peak resident memory, 4000 x 3000 JPEG ($(($(stat -c %s "$photo") / 1024)) kB)"
peer=0
for i in 1 2 3; do
  kb=$("$timer" -f %M vipsthumbnail "$photo" -s 1280 -o "$tmp/tn_%s.jpg" \
    2>&1 >/dev/null | tail -n 1)
  [ "$kb" -gt "$peer" ] && peer=$kb
done
printf '  %-54s %8d kB\n' "vipsthumbnail, one photo (largest of 3 runs)" "$peer"

# daemon_peak N: sets HWM to the daemon's VmHWM (kB) after a queue of N
# photos, and PER_PHOTO_MS.
daemon_peak() {
  local n=$1 dir=$tmp/photos$1 queue=$tmp/queue$1
  mkdir -p "$dir"
  for ((i = 0; i < n; i++)); do ln "$photo" "$dir/p$i.jpg"; done
  echo "$dir" >"$queue"
  local started=$(date +%s%N)
  "$mkthumbd" --foreground --queue "$queue" --pidfile "$tmp/pid$n" \
    >/dev/null 2>"$tmp/err$n" &
  daemon_pid=$!
  local limit=$((n * 40 + 100)) # 2 s a photo at most, in 50 ms steps
  for ((i = 0; i < limit; i++)); do
    [ -s "$queue" ] || break
    sleep 0.05
  done
  local ended=$(date +%s%N)
  if [ -s "$queue" ]; then
    echo "thumb_rss.sh: the daemon did not finish $n photos" >&2
    return 1
  fi
  PER_PHOTO_MS=$(((ended - started) / 1000000 / n))
  HWM=$(awk '/^VmHWM:/ { print $2 }' "/proc/$daemon_pid/status")
  kill -TERM "$daemon_pid"
  wait "$daemon_pid" 2>/dev/null
  daemon_pid=""
  local made
  made=$(find "$dir/.quvameta" -name 'QUVAPHOTO_THUMB_*.jpg' | wc -l)
  if [ "$made" -ne $((n * 4)) ]; then
    echo "thumb_rss.sh: $made thumbnails for $n photos" >&2
    return 1
  fi
}

daemon_peak 10 || exit 1
peak10=$HWM
ms10=$PER_PHOTO_MS
daemon_peak 100 || exit 1
peak100=$HWM
ms100=$PER_PHOTO_MS
printf '  %-54s %8d kB  (%d ms a photo)\n' "quvamkthumbd, queue of 10 photos" \
  "$peak10" "$ms10"
printf '  %-54s %8d kB  (%d ms a photo)\n' "quvamkthumbd, queue of 100 photos" \
  "$peak100" "$ms100"
awk -v d="$peak100" -v d10="$peak10" -v p="$peer" 'BEGIN {
  printf "  %-54s %8.2f x\n", "daemon (100 photos) / vipsthumbnail (1 photo)", d / p
  printf "  %-54s %8.2f x\n", "daemon 100 photos / 10 photos", d / d10
  r = d / p
  printf "  GOAL %-45s %8.2f (<= 1.50): %s\n", "daemon peak / vipsthumbnail peak", r,
         r <= 1.5 ? "met" : "MISSED"
  g = d / d10
  printf "  GOAL %-45s %8.2f (<= 1.10): %s\n", "no growth from 10 to 100 photos", g,
         g <= 1.1 ? "met" : "MISSED"
}'
