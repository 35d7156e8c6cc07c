#!/usr/bin/env bash
# `quvaidx scan` against `find DIR -type f | wc -l` over the same generated
# tree, in the same run.
#
#   bench/scan_bench.sh [BUILD_DIR]     (default build-bench)
#
# Generates two trees of 1,000 folders (10 groups of 100), one with 10 files
# per folder (10,000 files) and one with 100 (100,000 files), names spread
# over the media tables. On each tree, after one warm-up run of each
# command, runs find and scan alternately SCAN_BENCH_RUNS times (default 5)
# and prints the median wall times and their ratio; then the peak resident
# memory of one scan of each tree, which must not grow with the number of
# files. The trees live in a temporary directory (SCAN_BENCH_DIR, default
# /tmp) and are removed on exit, however the script ends.
set -euo pipefail

build=${1:-build-bench}
tool=$build/tools/quvaidx
runs=${SCAN_BENCH_RUNS:-5}
if [ ! -x "$tool" ]; then
  echo "scan_bench.sh: $tool not found; build the tool first" >&2
  exit 1
fi

work=$(mktemp -d "${SCAN_BENCH_DIR:-/tmp}/quvaidx-scan-bench.XXXXXX")
trap 'rm -rf "$work"' EXIT

# make_tree DIR FILES_PER_FOLDER
make_tree() {
  local dir=$1 per=$2 g s names=() i
  local exts=(jpg JPG png mp3 flac mp4 mkv avi m3u txt nef gif doc)
  for ((i = 0; i < per; i++)); do
    names+=("f$i.${exts[i % ${#exts[@]}]}")
  done
  for ((g = 0; g < 10; g++)); do
    for ((s = 0; s < 100; s++)); do
      mkdir -p "$dir/g$g/s$s"
    done
    # One touch per group keeps generation at a few seconds.
    (cd "$dir/g$g" && for s in s*; do printf "$s/%s\n" "${names[@]}"; done |
      xargs touch)
  done
}

# wall_ms CMD...: runs CMD with output discarded; prints its wall time in ms.
wall_ms() {
  local start=$EPOCHREALTIME end
  "$@" >/dev/null 2>&1
  end=$EPOCHREALTIME
  awk -v a="$start" -v b="$end" 'BEGIN { printf "%.2f", (b - a) * 1000 }'
}

median() { printf '%s\n' "$@" | sort -n | awk '{ v[NR] = $1 }
  END { print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }

find_count() { find "$1" -type f | wc -l; }
scan_summary() { "$tool" scan "$1"; }
scan_list() { "$tool" scan --list "$1" 2>/dev/null | wc -l; }

# peak_kib CMD...: the peak resident memory of CMD in KiB.
peak_kib() {
  if [ -x /usr/bin/time ]; then
    /usr/bin/time -f %M "$@" 2>&1 >/dev/null | tail -1
  else
    python3 -c 'import resource, subprocess, sys
subprocess.run(sys.argv[1:], stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
print(resource.getrusage(resource.RUSAGE_CHILDREN).ru_maxrss)' "$@"
  fi
}

echo "== quvaidx scan against find -type f | wc -l ($runs runs each, medians)"
echo "   machine: $(nproc) cores, load average $(cut -d' ' -f1-3 /proc/loadavg)"
status=0
for per in 10 100; do
  tree=$work/tree$per
  make_tree "$tree" "$per"
  files=$(find_count "$tree")
  listed=$(scan_list "$tree")
  if [ "$listed" -ne "$files" ]; then
    echo "scan listed $listed files, find counted $files" >&2
    status=1
  fi
  find_count "$tree" >/dev/null
  scan_summary "$tree" >/dev/null
  t_find=() t_scan=() t_list=()
  for ((i = 0; i < runs; i++)); do
    t_find+=("$(wall_ms find_count "$tree")")
    t_scan+=("$(wall_ms scan_summary "$tree")")
    t_list+=("$(wall_ms scan_list "$tree")")
  done
  m_find=$(median "${t_find[@]}")
  m_scan=$(median "${t_scan[@]}")
  m_list=$(median "${t_list[@]}")
  echo
  echo "-- $files files in 1000 folders"
  printf '   %-34s %9.2f ms\n' "find DIR -type f | wc -l" "$m_find" \
    "quvaidx scan DIR" "$m_scan" "quvaidx scan --list DIR | wc -l" "$m_list"
  awk -v f="$m_find" -v s="$m_scan" -v l="$m_list" 'BEGIN {
    printf "   ratio scan/find %.2f, scan --list/find %.2f (goal: at most 1.5)\n",
           s / f, l / f }'
  printf '   peak RSS: quvaidx scan %s KiB, quvaidx scan --list %s KiB, find %s KiB\n' \
    "$(peak_kib "$tool" scan "$tree")" \
    "$(peak_kib "$tool" scan --list "$tree")" \
    "$(peak_kib find "$tree" -type f)"
  rm -rf "$tree"
done
exit $status
