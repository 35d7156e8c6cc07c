#!/usr/bin/env bash
# Runs every libFuzzer target of a fuzzing build for a while.
#
#   scripts/fuzz.sh BUILD_DIR [SECONDS]
#
# BUILD_DIR was configured with -DQUVAIDX_BUILD_FUZZ=ON (see `make fuzz`);
# each target runs for SECONDS (default 20). A target's working corpus is
# BUILD_DIR/fuzz-corpus/<target>, seeded from fuzz/corpus/<target> when that
# exists; crash, leak and timeout inputs land in
# BUILD_DIR/fuzz-artifacts/<target>/ and full logs in BUILD_DIR/fuzz-logs/.
# fuzz_mediaparser_file is seeded with the media fixtures of the tests,
# made into BUILD_DIR/media-fixtures by tests/mediaparserd/make_fixtures.sh.
# Reproduce a finding with: BUILD_DIR/fuzz/<target> <artifact file>.
# A run takes about the number of targets times SECONDS, plus start-up.
# Exits non-zero when any target is missing or reports a finding.
set -euo pipefail

usage() {
  echo "usage: $0 BUILD_DIR [SECONDS]" >&2
  exit 2
}
[ $# -ge 1 ] && [ $# -le 2 ] || usage
build_dir=$1
seconds=${2:-20}
[[ $seconds =~ ^[1-9][0-9]*$ ]] || usage

root=$(cd "$(dirname "$0")/.." && pwd)
build_dir=$(cd "$build_dir" && pwd)
targets=(fuzz_event_server fuzz_recv_packet fuzz_host_ini fuzz_host_pid_file fuzz_file_rules fuzz_mediainfo fuzz_text fuzz_trim
         fuzz_proc_parse fuzz_spool_consumer fuzz_peer_groups fuzz_mediaparser_glue
         fuzz_mediaparser_file)

# Findings must stop the run with a stack trace; libFuzzer already checks for
# leaks after inputs whose allocations do not balance.
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}

failed=()
for target in "${targets[@]}"; do
  binary=$build_dir/fuzz/$target
  corpus=$build_dir/fuzz-corpus/$target
  artifacts=$build_dir/fuzz-artifacts/$target/
  log=$build_dir/fuzz-logs/$target.log
  echo "--- $target: ${seconds}s"
  if [ ! -x "$binary" ]; then
    echo "missing $binary (build with -DQUVAIDX_BUILD_FUZZ=ON)" >&2
    failed+=("$target")
    continue
  fi
  mkdir -p "$corpus" "$artifacts" "$(dirname "$log")"
  max_len=65536
  [ "$target" = fuzz_mediaparser_file ] && max_len=262144 # whole media files
  args=(-max_total_time="$seconds" -rss_limit_mb=2048 -timeout=10
        -max_len="$max_len" -print_final_stats=1 -artifact_prefix="$artifacts")
  if [ -f "$root/fuzz/$target.dict" ]; then
    args+=(-dict="$root/fuzz/$target.dict")
  fi
  dirs=("$corpus")
  if [ -d "$root/fuzz/corpus/$target" ]; then
    dirs+=("$root/fuzz/corpus/$target")
  fi
  if [ "$target" = fuzz_mediaparser_file ]; then
    if ! bash "$root/tests/mediaparserd/make_fixtures.sh" \
        "$build_dir/media-fixtures" >"$log" 2>&1; then
      echo "$target: no seed files (see $log)" >&2
      failed+=("$target")
      continue
    fi
    dirs+=("$build_dir/media-fixtures")
  fi
  # The outer time limit only guards against a fuzzer that stops answering.
  status=0
  timeout --kill-after=30 $((seconds + 300)) \
    "$binary" "${args[@]}" "${dirs[@]}" >"$log" 2>&1 || status=$?
  if [ "$status" -eq 0 ]; then
    grep -E '^(#[0-9]+[[:space:]]+DONE|stat::(number_of_executed_units|average_exec_per_sec|new_units_added|peak_rss_mb))' \
      "$log" || tail -n 5 "$log"
  else
    echo "$target FAILED (exit $status); end of $log:" >&2
    tail -n 60 "$log" >&2
    ls -l "$artifacts" >&2 || true
    failed+=("$target")
  fi
done

if [ ${#failed[@]} -ne 0 ]; then
  echo "fuzzing failed: ${failed[*]}" >&2
  exit 1
fi
echo "fuzzing passed: ${targets[*]}"
