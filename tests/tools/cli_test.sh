#!/usr/bin/env bash
# End-to-end checks of the quvaidx tool.
#
#   cli_test.sh TOOL CASE
#
# Runs one case against real `quvaidx serve` and `quvaidx send` processes in
# a fresh temporary directory. Every process the case starts is killed and
# the directory removed on exit, whatever the outcome. Each tool run is
# bounded by `timeout`, so a hang fails the case instead of stalling it.
set -euo pipefail

TOOL=$1
CASE=$2
# Socket paths must stay short (107 bytes), so the directory lives in /tmp.
WORK=$(mktemp -d /tmp/quvaidx-cli.XXXXXX)
PIDS=()

cleanup() {
  local pid
  for pid in "${PIDS[@]}"; do
    kill -KILL "$pid" 2>/dev/null || true
    wait "$pid" 2>/dev/null || true
  done
  rm -rf "$WORK"
}
trap cleanup EXIT

fail() {
  echo "FAIL [$CASE]: $*" >&2
  echo "--- last stdout:" >&2
  cat "$WORK/out" >&2 2>/dev/null || true
  echo "--- last stderr:" >&2
  cat "$WORK/err" >&2 2>/dev/null || true
  exit 1
}

# slurp VAR FILE: sets VAR to the text of FILE less its final line feed,
# without starting a process.
slurp() {
  local text=""
  IFS= read -r -d '' text <"$2" || true
  printf -v "$1" '%s' "${text%$'\n'}"
}

# run ARGS...: runs the tool; sets RC, OUT and ERR.
run() {
  set +e
  timeout 5 "$TOOL" "$@" >"$WORK/out" 2>"$WORK/err"
  RC=$?
  set -e
  slurp OUT "$WORK/out"
  slurp ERR "$WORK/err"
}

expect_rc() { [ "$RC" -eq "$1" ] || fail "exit status $RC, expected $1"; }
expect_out() { [ "$OUT" = "$1" ] || fail "stdout '$OUT', expected '$1'"; }
expect_out_has() {
  grep -qF -- "$1" "$WORK/out" || fail "stdout lacks '$1'"
}
expect_err_has() {
  grep -qF -- "$1" "$WORK/err" || fail "stderr lacks '$1'"
}
expect_no_out() { [ -z "$OUT" ] || fail "unexpected stdout '$OUT'"; }
expect_err_lines() {
  local lines
  mapfile -t lines <"$WORK/err"
  local n=${#lines[@]}
  [ "$n" -eq "$1" ] || fail "stderr has $n lines, expected $1"
}
# One error line, starting with $1, and nothing on stdout.
expect_one_error() {
  expect_rc 2
  expect_no_out
  expect_err_lines 1
  case "$ERR" in
    "$1"*) ;;
    *) fail "stderr '$ERR', expected it to start with '$1'" ;;
  esac
}

# start_server SOCKET NAME [OPTIONS...]: starts `quvaidx serve` in the
# background, output in $WORK/NAME.out and .err, and waits for its
# "listening" line. Sets SERVER_PID.
start_server() {
  local sock=$1 name=$2 i
  shift 2
  "$TOOL" serve --socket "$sock" "$@" >"$WORK/$name.out" 2>"$WORK/$name.err" &
  SERVER_PID=$!
  PIDS+=("$SERVER_PID")
  for ((i = 0; i < 250; i++)); do
    grep -qsF "quvaidx serve: listening on $sock" "$WORK/$name.out" && return 0
    kill -0 "$SERVER_PID" 2>/dev/null || fail "serve exited before listening"
    sleep 0.02
  done
  fail "serve did not report listening within 5 s"
}

# stop_server SIGNAL: signals the last server and waits up to 5 s for it to
# end. Sets SERVER_RC.
stop_server() {
  local i
  kill -"$1" "$SERVER_PID"
  for ((i = 0; i < 250; i++)); do
    kill -0 "$SERVER_PID" 2>/dev/null || break
    sleep 0.02
  done
  kill -0 "$SERVER_PID" 2>/dev/null && fail "serve ignored SIG$1"
  set +e
  wait "$SERVER_PID"
  SERVER_RC=$?
  set -e
}

case_help() {
  for args in "--help" "-h" "help"; do
    run $args
    expect_rc 0
    expect_out_has "Usage: quvaidx [--verbose] COMMAND"
    expect_out_has "send "
    expect_out_has "serve "
  done
  for command in send serve; do
    for flag in --help -h; do
      run "$command" "$flag"
      expect_rc 0
      expect_out_has "Usage: quvaidx $command --socket PATH"
    done
    run help "$command"
    expect_rc 0
    expect_out_has "Usage: quvaidx $command --socket PATH"
  done
}

case_usage_errors() {
  run bogus
  expect_rc 2
  expect_no_out
  [ "$ERR" = $'quvaidx: unknown command \'bogus\'\nTry \'quvaidx --help\'.' ] ||
    fail "stderr '$ERR'"
  run
  expect_rc 2
  expect_err_has "quvaidx: no command given"
  run --bogus
  expect_rc 2
  expect_err_has "quvaidx: unrecognised option '--bogus'"
  run send --bogus -s "$WORK/s" '{}'
  expect_rc 2
  expect_err_has "quvaidx send: unrecognised option '--bogus'"
  expect_err_has "Try 'quvaidx send --help'."
  run send '{}'
  expect_rc 2
  expect_err_has "quvaidx send: --socket PATH is required"
  run send -s "$WORK/s"
  expect_rc 2
  expect_err_has "quvaidx send: missing the JSON request"
  run send -s "$WORK/s" '{}' '{}'
  expect_rc 2
  expect_err_has "expects one JSON request"
  run send -s "$WORK/s" --attempts zero '{}'
  expect_rc 2
  expect_err_has "quvaidx send: --attempts needs a whole number"
  run send -s "$WORK/s" --attempts 0 '{}'
  expect_rc 2
  run send -s
  expect_rc 2
  expect_err_has "quvaidx send: option '-s' needs a value"
  run serve
  expect_rc 2
  expect_err_has "quvaidx serve: --socket PATH is required"
  run serve -s "$WORK/s" extra
  expect_rc 2
  expect_err_has "quvaidx serve: unexpected argument 'extra'"
  [ ! -e "$WORK/s" ] || fail "a usage error created the socket"
}

case_serve_and_send() {
  local sock=$WORK/d.sock lines
  start_server "$sock" serve
  [ -S "$sock" ] || fail "no socket at $sock"
  # With --handshake the daemon sees two requests: the handshake and ours.
  run send --socket "$sock" --handshake --compact '{"command":"HANDSHAKE"}'
  expect_rc 0
  expect_out '{"success":true}'
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  run send -s "$sock" -c '{"command":"ECHO","n":[1,2],"s":"x"}'
  expect_rc 0
  expect_out '{"echo":{"command":"ECHO","n":[1,2],"s":"x"},"success":true}'
  # Without --compact the reply is indented over several lines.
  run send -s "$sock" '{"command":"ECHO"}'
  expect_rc 0
  expect_out_has '"success" : true'
  mapfile -t lines <"$WORK/out"
  [ "${#lines[@]}" -gt 3 ] || fail "reply not pretty-printed"
  # Earlier clients have closed; only this connection is open.
  run send -s "$sock" -c '{"command":"STATS"}'
  expect_rc 0
  expect_out '{"connections":1,"requests":5,"success":true}'
  run send -s "$sock" --handshake --attempts 1 -c '{"command":"STATS"}'
  expect_rc 0
  expect_out '{"connections":1,"requests":7,"success":true}'
  stop_server TERM
  [ "$SERVER_RC" -eq 0 ] || fail "serve exited with $SERVER_RC"
}

case_exit_status_false() {
  local sock=$WORK/d.sock request
  start_server "$sock" serve
  for request in '{"command":"NOPE"}' '{"command":7}' '{}' '{"command":"echo"}'; do
    run send -s "$sock" -c "$request"
    expect_rc 1
    expect_out '{"reason":"unknown command","success":false}'
    [ -z "$ERR" ] || fail "stderr '$ERR'"
  done
  stop_server TERM
}

# Every failed connection attempt costs the tool one second, so the cases
# that need one run their clients side by side.
case_no_daemon() {
  local stale=$WORK/stale.sock none=$WORK/none.sock pid_quiet pid_verbose
  # A daemon killed outright leaves its socket behind, with no one on it.
  start_server "$stale" killed
  kill -KILL "$SERVER_PID"
  wait "$SERVER_PID" 2>/dev/null || true
  [ -S "$stale" ] || fail "the killed daemon's socket is gone"

  timeout 5 "$TOOL" send -s "$none" --attempts 1 '{}' \
    >"$WORK/quiet.out" 2>"$WORK/quiet.err" &
  pid_quiet=$!
  timeout 5 "$TOOL" --verbose send -s "$none" --attempts 1 '{}' \
    >"$WORK/verbose.out" 2>"$WORK/verbose.err" &
  pid_verbose=$!
  PIDS+=("$pid_quiet" "$pid_verbose")
  run send --socket "$stale" --attempts 1 '{"command":"HANDSHAKE"}'
  expect_one_error \
    "quvaidx send: no daemon answered on $stale after 1 attempt"

  set +e
  wait "$pid_quiet"
  RC=$?
  set -e
  cp "$WORK/quiet.out" "$WORK/out"
  cp "$WORK/quiet.err" "$WORK/err"
  slurp OUT "$WORK/out"
  slurp ERR "$WORK/err"
  expect_one_error "quvaidx send: no daemon answered on $none after 1 attempt"

  # --verbose adds the library's own log lines to the tool's message.
  set +e
  wait "$pid_verbose"
  RC=$?
  set -e
  cp "$WORK/verbose.err" "$WORK/err"
  expect_rc 2
  expect_err_has "quvaidx_ipc_core"
  expect_err_has "quvaidx send: no daemon answered on $none after 1 attempt"
}

case_stale_socket() {
  local sock=$WORK/d.sock
  start_server "$sock" first
  kill -KILL "$SERVER_PID"
  wait "$SERVER_PID" 2>/dev/null || true
  [ -S "$sock" ] || fail "the killed daemon's socket is gone"
  # A new daemon replaces the stale socket.
  start_server "$sock" second
  run send -s "$sock" -c '{"command":"HANDSHAKE"}'
  expect_rc 0
  expect_out '{"success":true}'
  stop_server TERM
  [ ! -e "$sock" ] || fail "socket left behind"
}

case_invalid_request() {
  local sock=$WORK/d.sock request deep big
  start_server "$sock" serve
  deep=$(printf '%*s' 5000 '' | tr ' ' '[')
  for request in '{"command":' '{} x' '' 'not json' "$deep" '{"a":1,}' '{"a":1,"a":2}' '{"a":1} // c'; do
    run send -s "$sock" "$request"
    expect_one_error "quvaidx send: invalid JSON request: "
  done
  for request in '[1]' '"HANDSHAKE"' 'null' '5'; do
    run send -s "$sock" "$request"
    expect_one_error "quvaidx send: the request must be a JSON object"
  done
  big=$(printf '%*s' 20000 '' | tr ' ' 'x')
  run send -s "$sock" "{\"command\":\"ECHO\",\"big\":\"$big\"}"
  expect_one_error "quvaidx send: the request is 20028 bytes long"
  expect_err_has "bytes long; a packet carries at most 16380"
  # None of these reached the daemon: this is its first request.
  run send -s "$sock" -c '{"command":"STATS"}'
  expect_rc 0
  expect_out '{"connections":1,"requests":1,"success":true}'
  stop_server TERM
}

case_socket_path_length() {
  local base=$WORK/ p107 p108
  p107=$base$(printf '%*s' $((107 - ${#base})) '' | tr ' ' 'p')
  p108=${p107}q
  [ ${#p107} -eq 107 ] || fail "test path has ${#p107} bytes"
  run send -s "$p108" '{"command":"HANDSHAKE"}'
  expect_one_error \
    "quvaidx send: socket path is 108 bytes long; a Unix-domain socket path holds at most 107"
  run serve -s "$p108"
  expect_one_error "quvaidx serve: socket path is 108 bytes long"
  if [ -e "$p108" ] || [ -e "$p107" ]; then fail "a socket file was created"; fi
  # The longest path that fits works end to end.
  start_server "$p107" serve
  run send -s "$p107" -c '{"command":"HANDSHAKE"}'
  expect_rc 0
  expect_out '{"success":true}'
  stop_server TERM
  [ ! -e "$p107" ] || fail "socket left behind"
}

case_stop_signals() {
  local sock=$WORK/d.sock sig
  for sig in TERM INT; do
    start_server "$sock" "serve$sig"
    stop_server "$sig"
    [ "$SERVER_RC" -eq 0 ] || fail "serve exited with $SERVER_RC on SIG$sig"
    [ ! -e "$sock" ] || fail "socket left behind after SIG$sig"
    grep -qF "quvaidx serve: stopped by SIG$sig" "$WORK/serve$sig.out" ||
      fail "no stop line after SIG$sig"
    [ ! -s "$WORK/serve$sig.err" ] || fail "serve wrote to stderr"
  done
}

case_serve_refuses_path() {
  local file=$WORK/file sock=$WORK/d.sock
  echo keep >"$file"
  run serve -s "$file"
  expect_one_error "quvaidx serve: $file exists and is not a socket"
  [ "$(cat "$file")" = keep ] || fail "the file was changed"
  start_server "$sock" first
  run serve -s "$sock"
  expect_one_error "quvaidx serve: a daemon is already listening on $sock"
  # The first daemon keeps its socket and still answers.
  run send -s "$sock" -c '{"command":"HANDSHAKE"}'
  expect_rc 0
  stop_server TERM
}

case_verbose() {
  local sock=$WORK/d.sock
  start_server "$sock" serve --verbose
  run send -s "$sock" '{"command":"HANDSHAKE"}'
  expect_rc 0
  stop_server TERM
  # The daemon's connection log line, at debug level, reached stderr.
  grep -qF "[quvaidx-serve] BEV_EVENT_EOF" "$WORK/serve.err" ||
    fail "no library log line on the daemon's stderr"
}

"case_$CASE"
echo "PASS [$CASE]"
