#!/usr/bin/env bash
# The media-parser daemon against its floor, ffprobe and MiniDLNA's initial
# scan, on one corpus: the media fixtures (tests/mediaparserd/make_fixtures.sh)
# linked COPIES times each into a temporary folder.
#
#   bench/mediaparser_bench.sh [BUILD_DIR]
#
# BUILD_DIR (default build-bench) holds bench/quvaidx_mediaparser_bench and
# the daemon. MiniDLNA (Debian package minidlna) scans the same folder in a
# private network namespace (unshare -n, loopback only) with a temporary
# configuration, database and log; its scan is timed from the moment its log
# says "Scanning DIR" to "Scanning DIR finished". Without minidlnad or
# unshare that comparison is skipped.
#
# Environment: COPIES (default 50), BENCH_REPETITIONS (default 5),
# BENCH_CPU (as in scripts/bench.sh; default the last CPU).
set -uo pipefail

build=${1:-build-bench}
root=$(cd "$(dirname "$0")/.." && pwd)
bench=$build/bench/quvaidx_mediaparser_bench
copies=${COPIES:-50}
reps=${BENCH_REPETITIONS:-5}
[ -x "$bench" ] || { echo "mediaparser_bench.sh: $bench not built" >&2; exit 1; }

cpu=${BENCH_CPU:-$(($(nproc) - 1))}
pin=()
if [ "$cpu" != none ] && command -v taskset >/dev/null 2>&1; then
  pin=(taskset -c "$cpu")
fi

fixtures=$build/media-fixtures
bash "$root/tests/mediaparserd/make_fixtures.sh" "$fixtures" || exit 1
work=$(mktemp -d /tmp/quvaidx-mpbench.XXXXXX)
minidlna_pid=
cleanup() {
  [ -n "$minidlna_pid" ] && kill "$minidlna_pid" 2>/dev/null && wait "$minidlna_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT
mkdir -p "$work/media" "$work/db" "$work/log"
for ((i = 1; i <= copies; i++)); do
  for f in "$fixtures"/*.*; do
    name=$i-$(basename "$f")
    ln "$f" "$work/media/$name" 2>/dev/null || cp "$f" "$work/media/$name"
  done
done
files=$(ls "$work/media" | wc -l)
echo "== corpus: $files files ($copies copies of the $(($files / copies)) fixtures)"

status=0
MEDIA_CORPUS=$work/media timeout 900 "${pin[@]}" "$bench" \
  --benchmark_repetitions="$reps" | tee "$work/bench.txt" || status=1
daemon_ms=$(awk '/MEDIAPARSER_MS_PER_FILE/ { print $2 }' "$work/bench.txt")

echo
echo "######## MiniDLNA's initial scan of the same corpus"
if ! command -v minidlnad >/dev/null || ! command -v unshare >/dev/null; then
  echo "minidlnad or unshare missing: skipped (Debian package minidlna)"
  exit $status
fi
cat >"$work/minidlna.conf" <<EOF
media_dir=$work/media
db_dir=$work/db
log_dir=$work/log
network_interface=lo
port=$((20000 + RANDOM % 20000))
inotify=no
friendly_name=quvaidx-bench
log_level=general,artwork,database,inotify,scanner,metadata,http,ssdp,tivo=warn
EOF
: >"$work/log/minidlna.log"
# The namespace has only its own loopback: nothing leaves the machine.
timeout 600 "${pin[@]}" unshare -n sh -c 'ip link set lo up 2>/dev/null; exec minidlnad -S -f "$1" -P "$2"' \
  sh "$work/minidlna.conf" "$work/minidlna.pid" >"$work/minidlna.out" 2>&1 &
minidlna_pid=$!
start= end=
while IFS= read -r line; do
  case $line in
    *"Scanning $work/media finished"*) end=$(date +%s%N); break ;;
    *"Scanning $work/media"*) start=$(date +%s%N) ;;
  esac
done < <(timeout 600 tail -n +1 -F "$work/log/minidlna.log" 2>/dev/null)
kill "$minidlna_pid" 2>/dev/null
wait "$minidlna_pid" 2>/dev/null
minidlna_pid=
if [ -z "$start" ] || [ -z "$end" ]; then
  echo "MiniDLNA's scan was not seen in its log:" >&2
  cat "$work/minidlna.out" "$work/log/minidlna.log" >&2
  exit 1
fi
scanned=$(sed -n 's/.*finished (\([0-9]*\) files).*/\1/p' "$work/log/minidlna.log")
awk -v s="$start" -v e="$end" -v n="$scanned" -v d="$daemon_ms" 'BEGIN {
  ms = (e - s) / 1e6 / n
  printf "  %-64s %12.3f ms\n", "MiniDLNA initial scan, per file (" n " files)", ms
  printf "  %-64s %12.3f ms\n", "daemon: QUVAIDX_GetMediaInfo per file", d
  ratio = ms / d
  verdict = (ratio >= 2) ? "met" : "MISSED"
  printf "  GOAL %-52s %8.3f (>= 2.00): %s\n", "MiniDLNA scan / daemon, per file",
         ratio, verdict
}'
exit $status
