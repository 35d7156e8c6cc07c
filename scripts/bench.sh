#!/usr/bin/env bash
# Runs the benchmarks built in BUILD_DIR (default build-bench) and counts the
# system calls per request of both servers with strace.
#
#   scripts/bench.sh [BUILD_DIR]
#
# Environment:
#   BENCH_REPETITIONS  repetitions of every benchmark (default 11), run in
#                      random interleaving; the summaries use medians
#   BENCH_MIN_TIME     seconds per repetition (default 0.2)
#   BENCH_FILTER       regular expression passed as --benchmark_filter
#   BENCH_CPU          CPU that every benchmark process is pinned to with
#                      taskset (default: the last one); "none" to let the
#                      scheduler spread client and server threads. Pinned,
#                      client and server threads take turns on one CPU, which
#                      keeps the figures steady on a machine shared with other
#                      work; unpinned, their spread varies from run to run.
#   BENCH_NO_STRACE=1  skip the system-call counts
#
# Every step runs under `timeout`; with the defaults the whole script takes
# about six minutes on two cores (the preview benchmarks about one of them,
# the media-parser comparison, run by bench/mediaparser_bench.sh, about
# two). Sockets live under /tmp and are removed;
# so are the task-queue benchmark's key file and message queues, also when it
# is interrupted. The spool benchmark writes its queues (up to 5.5 MB each)
# under /tmp and under the working directory, and removes them.
set -uo pipefail

build=${1:-build-bench}
bin="$build/bench"
reps=${BENCH_REPETITIONS:-11}
min_time=${BENCH_MIN_TIME:-0.2}
filter=${BENCH_FILTER:-}

for b in quvaidx_server_bench quvaidx_exchange_bench quvaidx_framing_bench \
         quvaidx_task_queue_bench quvaidx_mediainfo_bench quvaidx_classify_bench \
         quvaidx_bench_load quvaidx_spool_bench quvaidx_proc_stats_bench; do
  if [ ! -x "$bin/$b" ]; then
    echo "bench.sh: $bin/$b not found; build with -DQUVAIDX_BUILD_BENCH=ON" >&2
    exit 1
  fi
done

cpu=${BENCH_CPU:-$(($(nproc) - 1))}
pin=()
if [ "$cpu" != none ] && command -v taskset >/dev/null 2>&1; then
  pin=(taskset -c "$cpu")
fi

tmp=$(mktemp -d /tmp/quvaidx-bench.XXXXXX)
trap 'rm -rf "$tmp"' EXIT

echo "== machine: $(nproc) cores, load average $(cut -d' ' -f1-3 /proc/loadavg)"
if [ ${#pin[@]} -gt 0 ]; then
  echo "   benchmarks pinned to CPU $cpu (BENCH_CPU=none to unpin)"
fi
echo "   (other load on the machine makes wall-clock figures noisy;"
echo "    compare the ratios, which come from interleaved runs)"

status=0
args=(--benchmark_repetitions="$reps" --benchmark_min_time="$min_time")
[ -n "$filter" ] && args+=(--benchmark_filter="$filter")
for b in quvaidx_framing_bench quvaidx_task_queue_bench \
         quvaidx_mediainfo_bench quvaidx_classify_bench quvaidx_exchange_bench \
         quvaidx_server_bench quvaidx_spool_bench quvaidx_proc_stats_bench; do
  echo
  echo "######## $b"
  timeout 600 "${pin[@]}" "$bin/$b" "${args[@]}" || { echo "$b failed ($?)"; status=1; }
done

# The preview daemons (built with the daemons): thumbnails against
# vipsthumbnail and ImageMagick, size maps against a handshake, and the
# thumbnail daemon's peak memory over a queue of photos.
if [ -x "$bin/quvaidx_previews_bench" ]; then
  echo
  echo "######## quvaidx_previews_bench"
  timeout 900 "${pin[@]}" "$bin/quvaidx_previews_bench" \
    --plugind "$build/daemons/plugind/quvaindexplugind" "${args[@]}" ||
    { echo "quvaidx_previews_bench failed ($?)"; status=1; }
  echo
  echo "######## thumbnail daemon memory (bench/thumb_rss.sh)"
  timeout 900 "${pin[@]}" bash "$(dirname "$0")/../bench/thumb_rss.sh" \
    "$build" || status=1
fi

# The plug-in daemon's HANDSHAKE while requests wait on a stopped media
# parser, against the serial daemon it was (about 30 s, most of it the
# serial daemon's waits).
if [ -x "$bin/quvaidx_plugind_bench" ]; then
  echo
  echo "######## quvaidx_plugind_bench"
  timeout 300 "${pin[@]}" "$bin/quvaidx_plugind_bench" ||
    { echo "quvaidx_plugind_bench failed ($?)"; status=1; }
fi

if [ "${BENCH_NO_STRACE:-0}" = 1 ]; then exit $status; fi
if ! command -v strace >/dev/null 2>&1; then
  echo "strace not installed: no system-call counts" >&2
  exit $status
fi

load="$bin/quvaidx_bench_load"

# total_calls FILE: the calls column of the total line of `strace -c`.
total_calls() { awk '$NF == "total" { print $4 }' "$1"; }

# per_call_table FILE N: the busiest system calls, per request.
per_call_table() {
  awk -v n="$2" '$NF != "total" && $4 ~ /^[0-9]+$/ {
                   printf "      %-16s %7.2f\n", $NF, $4 / n }' "$1" |
    sort -k2 -nr | head -8
}

# traced_server KIND N CLIENTS: runs the server for N small requests under
# strace while an untraced driver sends them on CLIENTS connections; prints
# the total number of calls.
traced_server() {
  local kind=$1 n=$2 clients=$3 out="$tmp/strace-server.txt"
  local sock="$tmp/s.sock"
  timeout 120 strace -f -c -o "$out" "$load" serve "$kind" "$sock" "$n" \
    >/dev/null &
  local pid=$!
  timeout 120 "$load" drive "$sock" "$clients" "$((n / clients))" handshake \
    >/dev/null || status=1
  wait "$pid" || status=1
  cp "$out" "$tmp/last-server.txt"
  total_calls "$out"
}

# traced_client KIND N: runs an untraced server for N requests and N whole
# exchanges of the KIND client under strace; prints the total.
traced_client() {
  local kind=$1 n=$2 out="$tmp/strace-client.txt" sock="$tmp/c.sock"
  timeout 120 "$load" serve "$kind" "$sock" "$n" >/dev/null &
  local pid=$!
  timeout 120 strace -f -c -o "$out" "$load" exchange "$kind" "$sock" "$n" \
    >/dev/null || status=1
  wait "$pid" || status=1
  cp "$out" "$tmp/last-client.txt"
  total_calls "$out"
}

echo
echo "######## system calls per request (strace -f -c)"
echo "Per-request figures are (calls at 2N requests - calls at N) / N, which"
echo "cancels process start-up and shut-down."
n1=2000
n2=4000
for clients in 1 16; do
  for kind in library raw; do
    c1=$(traced_server "$kind" "$n1" "$clients")
    c2=$(traced_server "$kind" "$n2" "$clients")
    per=$(awk -v a="$c1" -v b="$c2" -v n="$((n2 - n1))" \
          'BEGIN { printf "%.2f", (b - a) / n }')
    echo "  server $kind, $clients client(s), small requests: $per syscalls/request"
    per_call_table "$tmp/last-server.txt" "$n2"
  done
done

echo
for kind in library raw; do
  c1=$(traced_client "$kind" "$n1")
  c2=$(traced_client "$kind" "$n2")
  per=$(awk -v a="$c1" -v b="$c2" -v n="$((n2 - n1))" \
        'BEGIN { printf "%.2f", (b - a) / n }')
  echo "  one exchange, $kind client (connect, send, receive, close):" \
       "$per syscalls/exchange"
  per_call_table "$tmp/last-client.txt" "$n2"
done

echo
timeout 600 bash "$(dirname "$0")/../bench/scan_bench.sh" "$build" || status=1

echo
echo "######## media-parser daemon: floor, ffprobe, MiniDLNA, memory"
timeout 1200 bash "$(dirname "$0")/../bench/mediaparser_bench.sh" "$build" || status=1
exit $status
