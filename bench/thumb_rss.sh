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
# for one, and no growth from 10 photos to 100.
#
# Then the formats whose decoder holds the whole image, each at the largest
# size the daemon's decode limit (384 MiB) admits, and at 100 megapixels,
# which it must refuse: one daemon run per photo, its peak (VmHWM) and what
# it did. Goal: every peak under the unit's MemoryMax=512M (at most 480 MiB,
# for the page cache beside it). Everything lives in one temporary
# directory, removed at exit; every wait is bounded.
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
# The daemon serves folders inside a share only: the whole directory is one,
# in the host stand-in's database of the run.
mkdir "$tmp/etc" && printf '[bench]\npath = %s\n' "$tmp" >"$tmp/etc/shares.conf"
export QUVA_HOST_ETC=$tmp/etc

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

# The worst formats at the limit. The photos are smooth noise (blurred
# more than the one above), so that they compress as photos do.
echo
echo "== Formats decoded whole, at the decode limit and at 100 megapixels"
vips gaussnoise "$tmp/n.v" 10000 10000 --mean 128 --sigma 60 &&
  vips gaussblur "$tmp/n.v" "$tmp/b.v" 4 &&
  vips cast "$tmp/b.v" "$tmp/g.v" uchar &&
  vips bandjoin "$tmp/g.v $tmp/g.v $tmp/g.v" "$tmp/j.v" &&
  vips copy "$tmp/j.v" "$tmp/big.v" --interpretation srgb || exit 1
rm -f "$tmp/n.v" "$tmp/b.v" "$tmp/g.v" "$tmp/j.v"
# worst_photo NAME SIDE SAVER [OPTIONS...]: a SIDE x SIDE photo saved by
# `vips SAVER` as NAME, in a folder of its own.
worst_photo() {
  local name=$1 side=$2 saver=$3
  shift 3
  mkdir -p "$tmp/w-$name" &&
    vips crop "$tmp/big.v" "$tmp/crop.v" 0 0 "$side" "$side" &&
    vips "$saver" "$tmp/crop.v" "$tmp/w-$name/$name" "$@" &&
    rm -f "$tmp/crop.v"
}
# The sides are about the largest the estimate admits under 384 MiB for
# such content (thumbnailer.h). The names say JPEG, as users may name
# anything: the content decides the decoder.
worst_photo prog444-52mp.jpg 7200 jpegsave --interlace --Q 95 &&
  worst_photo prog444-100mp.jpg 10000 jpegsave --interlace --Q 95 &&
  worst_photo gif-41mp.jpg 6400 gifsave --effort 1 &&
  worst_photo lossless-webp-70mp.jpg 8400 webpsave --lossless --effort 0 &&
  worst_photo lossless-webp-100mp.jpg 10000 webpsave --lossless --effort 0 &&
  worst_photo heif-46mp.jpg 6800 heifsave --effort 0 &&
  worst_photo interlaced-png-74mp.jpg 8600 pngsave --interlace &&
  worst_photo baseline-100mp.jpg 10000 jpegsave &&
  worst_photo plain-png-100mp.jpg 10000 pngsave || exit 1
rm -f "$tmp/big.v"

worst_peak=0
for dir in "$tmp"/w-*; do
  name=${dir#"$tmp"/w-}
  echo "$dir" >"$tmp/wqueue"
  "$mkthumbd" --foreground --stderr --queue "$tmp/wqueue" \
    --pidfile "$tmp/wpid" >/dev/null 2>"$tmp/werr" &
  daemon_pid=$!
  for ((i = 0; i < 1200; i++)); do # at most 60 s
    [ -s "$tmp/wqueue" ] || break
    sleep 0.05
  done
  if [ -s "$tmp/wqueue" ]; then
    echo "thumb_rss.sh: the daemon did not finish $name" >&2
    exit 1
  fi
  hwm=$(awk '/^VmHWM:/ { print $2 }' "/proc/$daemon_pid/status")
  kill -TERM "$daemon_pid"
  wait "$daemon_pid" 2>/dev/null
  daemon_pid=""
  if [ -s "$dir/.quvameta/$name/QUVAPHOTO_THUMB_S.jpg" ]; then
    did="made"
  else
    did="refused: $(grep -o 'would take [0-9]* MiB' "$tmp/werr" | head -n 1)"
  fi
  printf '  %-26s %6d kB file %8d kB peak  %s\n' "$name" \
    $(($(stat -c %s "$dir/$name") / 1024)) "$hwm" "$did"
  [ "$hwm" -gt "$worst_peak" ] && worst_peak=$hwm
done
awk -v w="$worst_peak" 'BEGIN {
  printf "  GOAL %-45s %8d kB (<= 491520): %s\n", "highest peak at the limit", w,
         w <= 491520 ? "met" : "MISSED"
}'
