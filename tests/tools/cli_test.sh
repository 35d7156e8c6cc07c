#!/usr/bin/env bash
# End-to-end checks of the quvaidx tool.
#
#   cli_test.sh TOOL CASE
#
# Runs one case against real `quvaidx` processes (daemons on sockets, task
# queues) in a fresh temporary directory. Every process the case starts is
# killed, every task queue it creates deleted and the directory removed on
# exit, whatever the outcome. Each tool run is bounded by `timeout`, so a
# hang fails the case instead of stalling it.
set -euo pipefail

TOOL=$1
CASE=$2
# Socket paths must stay short (107 bytes), so the directory lives in /tmp.
WORK=$(mktemp -d /tmp/quvaidx-cli.XXXXXX)
PIDS=()
QUEUES=() # "KEYFILE PROJECT ID" of every queue the case created
# The host's boot state lives in an empty directory: the machine counts as
# booted, so `serve` never waits for it.
export QUVA_HOST_ETC=$WORK/host-etc

cleanup() {
  local pid queue key project id
  for pid in "${PIDS[@]}"; do
    kill -KILL "$pid" 2>/dev/null || true
    wait "$pid" 2>/dev/null || true
  done
  for queue in "${QUEUES[@]}"; do
    read -r key project id <<<"$queue"
    timeout 5 "$TOOL" taskq delete "$key" "$project" >/dev/null 2>&1 || true
    # Should the tool have failed, the identifier still reaches the queue.
    ipcrm -q "$id" >/dev/null 2>&1 || true
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
    expect_out_has "daemons "
    expect_out_has "send "
    expect_out_has "serve "
    expect_out_has "taskq "
    expect_out_has "scan "
  done
  for command in daemons taskq scan; do
    for args in "$command --help" "$command -h" "help $command"; do
      run $args
      expect_rc 0
      expect_out_has "Usage: quvaidx $command "
    done
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
  expect_err_has "quvaidx send: --socket PATH or --daemon NAME is required"
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
  run serve -s "$WORK/s" --daemon
  expect_rc 2
  expect_err_has "quvaidx serve: --daemon needs --pidfile FILE"
  run daemons --bogus
  expect_rc 2
  expect_err_has "quvaidx daemons: unrecognised option '--bogus'"
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

# The daemon directory: name, pid file, executable, socket.
DAEMON_TABLE=(
  "controld /var/run/quvaindexd.pid /usr/quva/sbin/quvaindexd /tmp/quvaindexd_sock"
  "scand /var/run/quvaindexscand.pid /usr/quva/sbin/quvaindexscand /tmp/quvaindexscand_sock"
  "workerd /var/run/quvaindexworkerd.pid /usr/quva/sbin/quvaindexworkerd /tmp/quvaindexworkerd_sock"
  "plugind /var/run/quvaindexplugind.pid /usr/quva/sbin/quvaindexplugind /tmp/quvaindexplugind_sock"
  "mediad /var/run/quvamediaparserd.pid /usr/quva/sbin/quvamediaparserd /tmp/quvamediaparserd_sock"
)
KNOWN_DAEMONS="known daemons: controld, scand, workerd, plugind, mediad"

case_daemons_table() {
  local lines name pid_file bin sock i col heading cell prefix line
  run daemons
  expect_rc 0
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  mapfile -t lines <"$WORK/out"
  [ "${#lines[@]}" -eq 6 ] || fail "${#lines[@]} lines, expected a header and 5 rows"
  [[ ${lines[0]} =~ ^NAME\ +ALIVE\ +PID\ +PID\ FILE\ +EXECUTABLE\ +SOCKET$ ]] ||
    fail "header '${lines[0]}'"
  for ((i = 0; i < 5; i++)); do
    read -r name pid_file bin sock <<<"${DAEMON_TABLE[i]}"
    line=${lines[i + 1]}
    # Every cell starts where its column heading does.
    for col in "NAME:$name" "PID FILE:$pid_file" "EXECUTABLE:$bin" \
      "SOCKET:$sock"; do
      heading=${col%%:*}
      cell=${col#*:}
      prefix=${lines[0]%%"$heading"*}
      [ "${line:${#prefix}:${#cell}}" = "$cell" ] ||
        fail "row '$line': '$cell' not under '$heading'"
    done
    [[ $line == *"$sock" ]] || fail "row '$line' does not end with the socket"
    # Nothing runs the index daemons on a test machine.
    if [ ! -e "$pid_file" ]; then
      prefix=${lines[0]%%ALIVE*}
      [ "${line:${#prefix}:3}" = "no " ] || fail "row '$line': alive"
      prefix=${lines[0]%%PID*}
      [ "${line:${#prefix}:2}" = "- " ] || fail "row '$line': pid"
    fi
  done
  run daemons mediad scand
  expect_rc 0
  mapfile -t lines <"$WORK/out"
  [ "${#lines[@]}" -eq 3 ] || fail "${#lines[@]} lines for two names"
  [[ ${lines[1]} == mediad* && ${lines[2]} == scand* ]] ||
    fail "rows not in the order given"
  run daemons nosuchd
  expect_one_error "quvaidx daemons: unknown daemon 'nosuchd'; $KNOWN_DAEMONS"
}

case_daemons_json() {
  local i name pid_file bin sock
  run daemons --json
  expect_rc 0
  for ((i = 0; i < 5; i++)); do
    read -r name pid_file bin sock <<<"${DAEMON_TABLE[i]}"
    if command -v jq >/dev/null; then
      [ "$(jq -c ".[$i] | [.name, .pid_file, .executable, .socket]" \
        "$WORK/out")" = "[\"$name\",\"$pid_file\",\"$bin\",\"$sock\"]" ] ||
        fail "entry $i"
      if [ ! -e "$pid_file" ]; then
        [ "$(jq -c ".[$i] | [.alive, .pid]" "$WORK/out")" = "[false,null]" ] ||
          fail "entry $i: alive or pid"
      fi
    else
      expect_out_has "\"pid_file\" : \"$pid_file\""
      expect_out_has "\"socket\" : \"$sock\""
    fi
  done
  if command -v jq >/dev/null; then
    [ "$(jq -c 'length' "$WORK/out")" = 5 ] || fail "not an array of 5"
  fi
  run daemons -j workerd
  expect_rc 0
  expect_out_has '"name" : "workerd"'
  expect_out_has '"alive" : false'
}

case_send_daemon() {
  run send --daemon nosuchd '{"command":"HANDSHAKE"}'
  expect_one_error "quvaidx send: unknown daemon 'nosuchd'; $KNOWN_DAEMONS"
  run send -d scand -s "$WORK/s" '{}'
  expect_rc 2
  expect_err_has \
    "quvaidx send: give either --socket PATH or --daemon NAME, not both"
  # A known name resolves to the directory's socket, where nothing listens
  # on a test machine (one attempt: one second).
  if [ ! -e /tmp/quvaindexd_sock ]; then
    run send --daemon controld --attempts 1 '{"command":"HANDSHAKE"}'
    expect_one_error \
      "quvaidx send: no daemon answered on /tmp/quvaindexd_sock after 1 attempt"
  fi
}

# new_queue KEYFILE PROJECT: creates the key file and the queue, and has the
# queue deleted on exit.
new_queue() {
  : >"$1"
  run taskq create "$1" "$2"
  expect_rc 0
  [[ $OUT =~ ^[0-9]+$ ]] || fail "create printed '$OUT', not an identifier"
  QUEUES+=("$1 $2 $OUT")
}

case_taskq() {
  local key=$WORK/q.key big pop_pid
  new_queue "$key" 7
  run taskq push "$key" 7 '{"n":1}'
  expect_rc 0
  expect_no_out
  run taskq push "$key" 7 --type 2 '{"s":"two","n":2}'
  expect_rc 0
  run taskq count "$key" 7
  expect_rc 0
  expect_out 2
  # Type 2 is taken although it came second.
  run taskq pop "$key" 7 --type 2
  expect_rc 0
  expect_out '{"n":2,"s":"two"}'
  run taskq pop "$key" 7
  expect_rc 0
  expect_out '{"n":1}'
  run taskq count "$key" 7
  expect_out 0
  # The largest task a queue carries: 8191 bytes of text with its line end.
  big=$(printf '%*s' 8182 '' | tr ' ' 'x')
  run taskq push "$key" 7 "{\"a\":\"$big\"}"
  expect_rc 0
  run taskq push "$key" 7 "{\"a\":\"${big}y\"}"
  expect_one_error \
    "quvaidx taskq: the task is 8192 bytes long; a queue carries at most 8191"
  run taskq pop "$key" 7 --nowait
  expect_rc 0
  expect_out "{\"a\":\"$big\"}"
  # A blocking pop waits for the next push.
  timeout 5 "$TOOL" taskq pop "$key" 7 >"$WORK/wait.out" 2>"$WORK/wait.err" &
  pop_pid=$!
  PIDS+=("$pop_pid")
  sleep 0.2
  kill -0 "$pop_pid" 2>/dev/null || fail "the blocking pop did not wait"
  run taskq push "$key" 7 --type 5 '{"late":true}'
  expect_rc 0
  wait "$pop_pid" || fail "the blocking pop failed"
  [ "$(cat "$WORK/wait.out")" = '{"late":true}' ] ||
    fail "the blocking pop printed '$(cat "$WORK/wait.out")'"
  # Empty: one attempt, one second, exit status 1.
  run taskq pop "$key" 7 --nowait --attempts 1
  expect_rc 1
  expect_no_out
  [ "$ERR" = "quvaidx taskq: no task of type 0 after 1 attempt" ] ||
    fail "stderr '$ERR'"
  # create discards what the earlier queue held.
  run taskq push "$key" 7 '{"old":1}'
  expect_rc 0
  new_queue "$key" 7
  run taskq count "$key" 7
  expect_out 0
  run taskq delete "$key" 7
  expect_rc 0
  expect_no_out
  run taskq count "$key" 7
  expect_one_error "quvaidx taskq: no queue for key file $key, project 7"
  run taskq delete "$key" 7
  expect_rc 0
}

case_taskq_errors() {
  local key=$WORK/k.key none=$WORK/none.key args message
  : >"$key"
  run taskq create "$none" 7
  expect_one_error "quvaidx taskq: key file $none: No such file or directory"
  run taskq delete "$none" 7
  expect_one_error "quvaidx taskq: key file $none: No such file or directory"
  # No queue was made for this key file.
  run taskq push "$key" 9 '{"a":1}'
  expect_one_error "quvaidx taskq: no queue for key file $key, project 9"
  run taskq pop "$key" 9 --nowait
  expect_one_error "quvaidx taskq: no queue for key file $key, project 9"
  run taskq push "$key" 9 '{"a":1'
  expect_one_error "quvaidx taskq: invalid JSON task: "
  run taskq push "$key" 9 '[1]'
  expect_one_error "quvaidx taskq: the task must be a JSON object"
  while IFS='|' read -r args message; do
    # shellcheck disable=SC2086 # the arguments are split on purpose
    run taskq $args
    expect_rc 2
    expect_no_out
    expect_err_has "quvaidx taskq: $message"
    expect_err_has "Try 'quvaidx taskq --help'."
  done <<END
|missing the operation
list $key 9|unknown operation 'list'
create $key|create needs PATH and PROJECT
push $key 9|push needs PATH, PROJECT and JSON
count $key 9 extra|unexpected argument 'extra'
count $key 0|PROJECT needs a whole number from 1 to 255, not '0'
count $key 256|PROJECT needs a whole number from 1 to 255, not '256'
count $key --size 4 9|--size does not apply to count
push $key 9 {} --nowait|--nowait does not apply to push
delete $key 9 --type 2|--type does not apply to delete
pop $key 9 --attempts 2|--attempts applies to pop --nowait only
pop $key 9 --nowait --attempts 0|--attempts needs a whole number from 1 to 3600
push $key 9 {} --type 0|push --type needs a type of 1 or more
pop $key 9 --type x|--type needs a whole number, not 'x'
create $key 9 --size 0|--size needs a whole number of KiB
END
}

# wait_gone PID: waits up to 5 s for a process that is not a child to end.
# A zombie counts as ended: whoever adopted the detached process may be slow
# to reap it.
wait_gone() {
  local i stat
  for ((i = 0; i < 250; i++)); do
    stat=$(cat "/proc/$1/stat" 2>/dev/null) || return 0
    stat=${stat##*) }
    [ "${stat:0:1}" = Z ] && return 0
    sleep 0.02
  done
  fail "process $1 is still running"
}

case_serve_pidfile() {
  local sock=$WORK/d.sock pid_file=$WORK/d.pid
  # A pid file naming no process does not stop the start.
  printf '4000000' >"$pid_file"
  start_server "$sock" serve --pidfile "$pid_file"
  [ "$(cat "$pid_file")" = "$SERVER_PID" ] ||
    fail "pid file holds '$(cat "$pid_file")'"
  stop_server TERM
  [ "$SERVER_RC" -eq 0 ] || fail "serve exited with $SERVER_RC"
  [ ! -e "$pid_file" ] || fail "pid file left behind"
  [ ! -e "$sock" ] || fail "socket left behind"
}

case_serve_pidfile_alive() {
  local pid_file=$WORK/d.pid
  start_server "$WORK/a.sock" first --pidfile "$pid_file"
  run serve --socket "$WORK/b.sock" --pidfile "$pid_file"
  expect_rc 2
  expect_out "Daemon alive. No need to start"
  [ ! -e "$WORK/b.sock" ] || fail "the refused daemon made its socket"
  [ "$(cat "$pid_file")" = "$SERVER_PID" ] || fail "the pid file was changed"
  run serve --socket "$WORK/b.sock" --pidfile "$pid_file" --daemon
  expect_rc 2
  expect_out "Daemon alive. No need to start"
  [ ! -e "$WORK/b.sock" ] || fail "the refused daemon made its socket"
  run send -s "$WORK/a.sock" -c '{"command":"HANDSHAKE"}'
  expect_rc 0
  stop_server TERM
  [ ! -e "$pid_file" ] || fail "pid file left behind"
}

case_serve_daemon() {
  local pid_file=$WORK/d.pid sock=$WORK/d.sock launcher pid i
  # Failures the detached process could not report are found beforehand.
  run serve --daemon --pidfile "$WORK/none/d.pid" --socket "$sock"
  expect_one_error "quvaidx serve: cannot create the pid file $WORK/none/d.pid: $WORK/none: No such file or directory"
  run serve --daemon --pidfile "$pid_file" --socket "$WORK/none/d.sock"
  expect_one_error "quvaidx serve: cannot create the socket $WORK/none/d.sock: $WORK/none: No such file or directory"
  # Relative paths: the detached daemon works in "/", yet must use these.
  (cd "$WORK" && exec timeout 5 "$TOOL" serve --daemon --pidfile d.pid \
    --socket d.sock >"$WORK/out" 2>"$WORK/err") &
  launcher=$!
  set +e
  wait "$launcher"
  RC=$?
  set -e
  slurp OUT "$WORK/out"
  slurp ERR "$WORK/err"
  expect_rc 0
  expect_no_out
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  for ((i = 0; i < 250; i++)); do
    [ -s "$pid_file" ] && [ -S "$sock" ] && break
    sleep 0.02
  done
  [ -s "$pid_file" ] || fail "no pid file"
  [ -S "$sock" ] || fail "no socket"
  pid=$(cat "$pid_file")
  PIDS+=("$pid")
  [ "$pid" != "$launcher" ] || fail "the daemon did not detach"
  kill -0 "$pid" 2>/dev/null || fail "the pid file names no live process"
  run send -s "$sock" -c '{"command":"HANDSHAKE"}'
  expect_rc 0
  expect_out '{"success":true}'
  kill -TERM "$(cat "$pid_file")"
  wait_gone "$pid"
  [ ! -e "$pid_file" ] || fail "pid file left behind"
  [ ! -e "$sock" ] || fail "socket left behind"
}

# ---------------------------------------------------------------------------
# quvaidx scan

# make_tree DIR: a sample share: media of every table, upper-case
# extensions, names the index skips, symbolic links (one a loop) and a pipe.
make_tree() {
  local d=$1
  mkdir -p "$d"/{Music,Video,Photos/raw,Photos.app,'#recycle','#snapshot'} \
    "$d"/{.quvameta/IMG.JPG,a,album.old}
  touch "$d"/Music/{SONG.MP3,b.flac,list.m3u,._SONG.MP3} \
    "$d"/Video/{a.mp4,b.mkv,C.AVI,d.srt} \
    "$d"/Photos/{IMG.JPG,b.png,c.gif,d.psd} "$d"/Photos/raw/e.NEF \
    "$d"/Photos.app/inside.jpg "$d"/'#recycle'/old.mp3 \
    "$d"/.quvameta/IMG.JPG/thumb.jpg "$d"/{._x.jpg,.hidden.jpg,notes.txt,noext} \
    "$d"/a/f.jpg "$d"/album.old/track
  ln -s .. "$d"/a/loop
  ln -s Music/SONG.MP3 "$d"/link.mp3
  mkfifo "$d"/pipe
}

# The counts of make_tree's sample, as scan_counts prints them.
TREE_COUNTS="folders=7
skipped.app_bundle=1
skipped.apple_double=2
skipped.loop=0
skipped.metadata_folder=1
skipped.other_name=0
skipped.recycle_bin=1
skipped.remote_or_image_mount=0
skipped.snapshot=1
skipped.special=1
skipped.symlink=2
skipped.under_recycle_bin=0
skipped_total=9
tables.music=2
tables.other=3
tables.photo=7
tables.playlist=1
tables.video=4
thumbnails.folders=4
thumbnails.photos=6
total_files=17
unreadable_folders=0
web_conversion_photos=5
web_video=2"

# The --list lines of make_tree's sample under ROOT, sorted.
tree_list() {
  local r=$1
  printf '%s\n' "music	$r/Music/SONG.MP3" "music	$r/Music/b.flac" \
    "playlist	$r/Music/list.m3u" "video	$r/Video/a.mp4" \
    "video	$r/Video/b.mkv" "video	$r/Video/C.AVI" "video	$r/Video/d.srt" \
    "photo	$r/Photos/IMG.JPG" "photo	$r/Photos/b.png" \
    "photo	$r/Photos/c.gif" "photo	$r/Photos/d.psd" \
    "photo	$r/Photos/raw/e.NEF" "photo	$r/.hidden.jpg" \
    "other	$r/notes.txt" "other	$r/noext" "photo	$r/a/f.jpg" \
    "other	$r/album.old/track" | LC_ALL=C sort
}

# scan_counts FILE: the numbers of a scan's JSON summary, one "path=value"
# line each, sorted; the elapsed time is left out.
scan_counts() {
  python3 - "$1" <<'PY'
import json, sys
data = json.load(open(sys.argv[1]))
out = []
def walk(prefix, value):
    if isinstance(value, dict):
        for key, item in value.items():
            walk(prefix + key + ".", item)
    elif isinstance(value, bool) or not isinstance(value, int):
        return
    else:
        out.append(prefix[:-1] + "=" + str(value))
for key in ("elapsed_seconds", "roots", "files"):
    data.pop(key, None)
walk("", data)
print("\n".join(sorted(out)))
PY
}

# expect_counts EXPECTED: the JSON summary in $WORK/out holds these counts.
expect_counts() {
  local got
  got=$(scan_counts "$WORK/out") || fail "stdout is not a JSON object"
  [ "$got" = "$1" ] || fail "counts differ:
$(diff <(echo "$1") <(echo "$got"))"
}

# as_unprivileged CMD...: runs CMD as user nobody, or returns 3 when the
# machine offers no way to.
as_unprivileged() {
  if command -v setpriv >/dev/null &&
    setpriv --reuid=65534 --regid=65534 --clear-groups true 2>/dev/null; then
    setpriv --reuid=65534 --regid=65534 --clear-groups "$@"
  elif command -v runuser >/dev/null && runuser -u nobody -- true 2>/dev/null; then
    runuser -u nobody -- "$@"
  else
    return 3
  fi
}

case_scan_counts() {
  local root
  make_tree "$WORK/tree"
  root=$(cd -P "$WORK/tree" && pwd)
  run scan --json "$WORK/tree"
  expect_rc 0
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  expect_counts "$TREE_COUNTS"
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]));
assert d["roots"] == [sys.argv[2]], d["roots"]
assert "files" not in d and d["elapsed_seconds"] >= 0' "$WORK/out" "$root" ||
    fail "roots or elapsed time"
  # The text summary says the same.
  run scan "$WORK/tree"
  expect_rc 0
  expect_out_has "Scanned 7 folders and 17 files in "
  expect_out_has "  video            4   2 playable on the web"
  expect_out_has "  photo            7   6 need thumbnails, in 4 folders; 5 converted for the web"
  expect_out_has "Skipped 9 entries:"
  expect_out_has "  AppleDouble files (\"._\" names)                  2"
  expect_out_has "  metadata folders (\".quvameta\")                  1"
  expect_out_has "  symbolic links (never followed)                 2"
  # A root given twice is walked twice; a trailing '/' changes nothing.
  run scan --json "$WORK/tree/" "$WORK/tree/Music"
  expect_rc 0
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]));
assert d["total_files"] == 20 and d["tables"]["music"] == 4, d' "$WORK/out" ||
    fail "two roots"
}

case_scan_list() {
  local root
  make_tree "$WORK/tree"
  root=$(cd -P "$WORK/tree" && pwd)
  run scan --list "$WORK/tree"
  expect_rc 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(tree_list "$root")" ] ||
    fail "list differs:
$(diff <(tree_list "$root") <(LC_ALL=C sort "$WORK/out"))"
  # The summary moved to stderr, leaving stdout to the list.
  expect_err_has "Scanned 7 folders and 17 files in "
  # With --json the list is the "files" member of the summary object.
  run scan --json --list "$WORK/tree"
  expect_rc 0
  expect_counts "$TREE_COUNTS"
  [ "$(python3 -c 'import json,sys
for f in json.load(open(sys.argv[1]))["files"]:
    print(f["table"] + "\t" + f["path"])' "$WORK/out" | LC_ALL=C sort)" = \
    "$(tree_list "$root")" ] || fail "JSON list differs"
  # An empty tree still gives one valid object.
  mkdir "$WORK/empty"
  run scan -j -l "$WORK/empty"
  expect_rc 0
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]));
assert d["files"] == [] and d["folders"] == 1 and d["total_files"] == 0' \
    "$WORK/out" || fail "empty tree"
}

case_scan_list_escapes() {
  local root
  mkdir "$WORK/odd"
  touch "$WORK/odd/"$'tab\tname.mp3' "$WORK/odd/"$'new\nline.jpg' \
    "$WORK/odd/back\\slash.png"
  root=$(cd -P "$WORK/odd" && pwd)
  run scan --list "$WORK/odd"
  expect_rc 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(printf '%s\n' \
    "music	$root/tab\\tname.mp3" "photo	$root/back\\\\slash.png" \
    "photo	$root/new\\nline.jpg" | LC_ALL=C sort)" ] || fail "escapes"
  run scan --json --list "$WORK/odd"
  expect_rc 0
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]))
names = sorted(f["path"].rsplit("/", 1)[1] for f in d["files"])
assert names == ["back\\slash.png", "new\nline.jpg", "tab\tname.mp3"], names' \
    "$WORK/out" || fail "JSON names"
}

case_scan_unreadable() {
  local root
  make_tree "$WORK/tree"
  mkdir -p "$WORK/tree/locked/inner"
  touch "$WORK/tree/locked/inner/x.mp3" "$WORK/tree/locked/y.jpg"
  chmod 000 "$WORK/tree/locked"
  root=$(cd -P "$WORK/tree" && pwd)
  if [ "$(id -u)" -eq 0 ]; then
    # chmod 000 does not stop root: read as nobody, who needs a way in.
    chmod 755 "$WORK"
    set +e
    as_unprivileged timeout 5 "$TOOL" scan --json "$WORK/tree" \
      >"$WORK/out" 2>"$WORK/err"
    RC=$?
    set -e
    chmod 700 "$WORK"
    if [ "$RC" -eq 3 ] && [ ! -s "$WORK/err" ]; then
      chmod 755 "$WORK/tree/locked"
      echo "SKIP [$CASE]: running as root with no way to drop privileges"
      return 0
    fi
  else
    run scan --json "$WORK/tree"
  fi
  chmod 755 "$WORK/tree/locked"
  slurp ERR "$WORK/err"
  expect_rc 1
  [ "$ERR" = "quvaidx scan: cannot read $root/locked: Permission denied" ] ||
    fail "stderr '$ERR'"
  # Everything else was scanned: the sample's counts, one unreadable folder.
  expect_counts "${TREE_COUNTS/unreadable_folders=0/unreadable_folders=1}"
}

case_scan_errors() {
  mkdir "$WORK/d"
  touch "$WORK/file"
  run scan
  expect_rc 2
  expect_err_has "quvaidx scan: missing the folder DIR"
  expect_err_has "Try 'quvaidx scan --help'."
  run scan --bogus "$WORK/d"
  expect_rc 2
  expect_err_has "quvaidx scan: unrecognised option '--bogus'"
  run scan "$WORK/none"
  expect_one_error "quvaidx scan: cannot scan $WORK/none: No such file or directory"
  run scan "$WORK/file"
  expect_one_error "quvaidx scan: cannot scan $WORK/file: not a folder"
  # Every DIR is checked before anything is scanned.
  run scan --json "$WORK/d" "$WORK/none" "$WORK/file"
  expect_rc 2
  expect_no_out
  expect_err_lines 2
}

case_scan_recycle_root() {
  local root
  mkdir -p "$WORK/#recycle/sub"
  touch "$WORK/#recycle/sub/a.mp3"
  root=$(cd -P "$WORK/#recycle/sub" && pwd)
  # The rule reads the third component as the share's recycle bin.
  if ! [[ $root =~ ^/[^/]+/[^/]+/#recycle/ ]]; then
    echo "SKIP [$CASE]: $root does not have the form /VOLUME/SHARE/#recycle"
    return 0
  fi
  run scan --json "$WORK/#recycle/sub"
  expect_rc 0
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]));
assert d["skipped"]["under_recycle_bin"] == 1 and d["folders"] == 0 \
  and d["total_files"] == 0, d' "$WORK/out" || fail "recycle bin walked"
}

# In a private mount namespace (gone with its process, so nothing outlives
# the case): a local mount point is walked, a bind mount of the root is a
# loop.
case_scan_mounts() {
  mkdir -p "$WORK/tree/mnt" "$WORK/tree/a/bind"
  touch "$WORK/tree/a.mp3"
  if ! unshare -m --propagation private true 2>/dev/null; then
    echo "SKIP [$CASE]: no private mount namespace here"
    return 0
  fi
  set +e
  timeout 5 unshare -m --propagation private bash -c '
    mount -t tmpfs none "$1/mnt" && touch "$1/mnt/b.jpg" &&
      mount --bind "$1" "$1/a/bind" || exit 3
    exec "$2" scan --json "$1"' _ "$WORK/tree" "$TOOL" \
    >"$WORK/out" 2>"$WORK/err"
  RC=$?
  set -e
  if [ "$RC" -eq 3 ]; then
    echo "SKIP [$CASE]: mounting is not allowed here"
    return 0
  fi
  expect_rc 0
  python3 -c 'import json,sys; d=json.load(open(sys.argv[1]));
assert d["skipped"]["loop"] == 1 and d["folders"] == 3, d
assert d["tables"]["music"] == 1 and d["tables"]["photo"] == 1, d' \
    "$WORK/out" || fail "mounts: $(cat "$WORK/out")"
}

case_scan_queue_thumbs() {
  if [ -e /var/run/quvamkthumbd.pid ]; then
    echo "SKIP [$CASE]: a thumbnail daemon may be running here"
    return 0
  fi
  make_tree "$WORK/tree"
  run scan --queue-thumbs --json "$WORK/tree"
  expect_rc 1
  expect_err_lines 1
  case "$ERR" in
    "quvaidx scan: cannot queue /"*" for thumbnails: the thumbnail daemon is not running"*) ;;
    *) fail "stderr '$ERR'" ;;
  esac
  python3 -c 'import json,sys; t=json.load(open(sys.argv[1]))["thumbnails"];
assert t == {"photos": 6, "folders": 4, "queued": 0, "not_queued": 4}, t' \
    "$WORK/out" || fail "thumbnail counts"
}

# expect_file FILE TEXT: FILE holds exactly TEXT (printf format).
expect_file() {
  # shellcheck disable=SC2059 # the format is the expectation
  printf -- "$2" >"$WORK/expected"
  cmp -s "$1" "$WORK/expected" ||
    fail "$1 holds '$(cat "$1")', expected '$(cat "$WORK/expected")'"
}

case_spool_add() {
  local q=$WORK/q.queue long
  for args in "spool --help" "help spool"; do
    run $args
    expect_rc 0
    expect_out_has "Usage: quvaidx spool add  QUEUE ENTRY..."
  done
  run spool add "$q" /share/a
  expect_rc 0
  expect_no_out
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  # Added twice, it is queued once; a new entry in the same call is added.
  run spool add "$q" /share/a /share/b /share/b
  expect_rc 0
  expect_file "$q" '/share/a\n/share/b\n'
  # One bad entry anywhere and nothing is added.
  run spool add "$q" /share/c $'/share/x\n/share/y'
  expect_one_error "quvaidx spool: an entry must not hold a line feed (entry 2); nothing was added"
  run spool add "$q" /share/c ''
  expect_one_error "quvaidx spool: an empty entry cannot be queued (entry 2)"
  long=/$(printf '%*s' 4094 '' | tr ' ' 'x')
  run spool add "$q" "${long}y"
  expect_one_error "quvaidx spool: an entry is 4096 bytes long; a queue line holds at most 4095"
  expect_file "$q" '/share/a\n/share/b\n'
  # The longest entry fits, and one that starts with '-' follows "--".
  run spool add "$q" "$long"
  expect_rc 0
  run spool add -- "$q" -dash
  expect_rc 0
  [ "$(sed -n 3p "$q")" = "$long" ] || fail "the longest entry was not queued"
  [ "$(sed -n 4p "$q")" = -dash ] || fail "the '-dash' entry was not queued"
  [ "$(wc -l <"$q")" -eq 4 ] || fail "$(wc -l <"$q") lines, expected 4"
  run spool add "$WORK/none/q" /share/a
  expect_one_error "quvaidx spool: cannot create $WORK/none/q: $WORK/none: No such file or directory"
  run spool add "$WORK" /share/a
  expect_one_error "quvaidx spool: $WORK is not a regular file"
  while IFS='|' read -r args message; do
    # shellcheck disable=SC2086 # the arguments are split on purpose
    run spool $args
    expect_rc 2
    expect_no_out
    expect_err_has "quvaidx spool: $message"
    expect_err_has "Try 'quvaidx spool --help'."
  done <<END
|missing the operation: add or trim
list $q|unknown operation 'list'
add $q|add needs QUEUE and an ENTRY
add --bogus $q /a|unrecognised option '--bogus'
END
}

case_spool_trim() {
  local q=$WORK/q.queue rest
  printf '/a\n/b\n/c\n/d\n/e' >"$q" # the last line has no line feed
  chmod 640 "$q"
  run spool trim "$q" 0
  expect_rc 0
  expect_file "$q" '/a\n/b\n/c\n/d\n/e'
  run spool trim "$q" 2
  expect_rc 0
  expect_no_out
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  expect_file "$q" '/c\n/d\n/e'
  [ "$(stat -c %a "$q")" = 640 ] || fail "mode $(stat -c %a "$q"), expected 640"
  run spool trim "$q" 3
  expect_rc 0
  expect_file "$q" ''
  run spool trim "$q" 1
  expect_rc 0
  rest=$(ls -A "$WORK")
  [ "$rest" = "$(printf 'err\nexpected\nout\nq.queue')" ] ||
    fail "files left beside the queue: $rest"
  run spool trim "$WORK/none" 1
  expect_one_error "quvaidx spool: $WORK/none: No such file or directory"
  run spool trim "$WORK" 1
  expect_one_error "quvaidx spool: $WORK is not a regular file"
  while IFS='|' read -r args message; do
    # shellcheck disable=SC2086 # the arguments are split on purpose
    run spool $args
    expect_rc 2
    expect_no_out
    expect_err_has "quvaidx spool: $message"
  done <<END
trim $q|trim needs QUEUE and N
trim $q -1|unrecognised option '-1'
trim $q x|N needs a whole number of lines from 0 to 2147483647, not 'x'
trim $q 1 2|unexpected argument '2'
END
}

# The trim waits for the queue's lock, and an entry added meanwhile is in
# the queue afterwards, whichever of the two got the lock first.
case_spool_trim_lock() {
  local q=$WORK/q.queue trim_pid add_pid inode
  printf '/a\n/b\n/c\n' >"$q"
  inode=$(stat -c %i "$q")
  exec 9<"$q"
  flock -x 9
  timeout 5 "$TOOL" spool trim "$q" 1 >"$WORK/trim.out" 2>"$WORK/trim.err" 9<&- &
  trim_pid=$!
  timeout 5 "$TOOL" spool add "$q" /d >"$WORK/add.out" 2>"$WORK/add.err" 9<&- &
  add_pid=$!
  PIDS+=("$trim_pid" "$add_pid")
  sleep 0.3
  kill -0 "$trim_pid" 2>/dev/null || fail "the trim did not wait for the lock"
  kill -0 "$add_pid" 2>/dev/null || fail "the add did not wait for the lock"
  expect_file "$q" '/a\n/b\n/c\n'
  [ "$(stat -c %i "$q")" = "$inode" ] || fail "the queue was replaced under the lock"
  flock -u 9
  exec 9<&-
  wait "$trim_pid" || fail "the trim failed: $(cat "$WORK/trim.err")"
  wait "$add_pid" || fail "the add failed: $(cat "$WORK/add.err")"
  expect_file "$q" '/b\n/c\n/d\n'
}

case_thumb() {
  local fifo=$WORK/fifo queue_before kind daemon
  run thumb --help
  expect_rc 0
  expect_out_has "Usage: quvaidx thumb [--video] PATH..."
  run thumb
  expect_rc 2
  expect_err_has "quvaidx thumb: missing PATH"
  run thumb "$WORK/none"
  expect_one_error "quvaidx thumb: $WORK/none: No such file or directory"
  mkfifo "$fifo"
  run thumb --video "$fifo"
  expect_one_error "quvaidx thumb: $fifo is neither a directory nor a regular file"
  # Nothing runs the preview daemons on a test machine.
  for kind in "thumbnail quvamkthumbd" "web-video quvamkflvd"; do
    read -r kind daemon <<<"$kind"
    [ ! -e "/var/run/$daemon.pid" ] || continue
    queue_before=$(ls -l /var/spool/thumb_create.queue \
      /var/spool/flv_create.queue 2>&1 || true)
    if [ "$kind" = thumbnail ]; then run thumb "$WORK"; else run thumb -V "$WORK"; fi
    expect_one_error "quvaidx thumb: the $kind daemon ($daemon) is not running: /var/run/$daemon.pid names no live process; nothing was queued"
    [ "$(ls -l /var/spool/thumb_create.queue /var/spool/flv_create.queue \
      2>&1 || true)" = "$queue_before" ] || fail "a queue was touched"
  done
}

case_stats() {
  local pid lines fds status_rss status_vm total i comm
  run stats --help
  expect_rc 0
  expect_out_has "Usage: quvaidx stats [--json] [PID]"
  run stats
  expect_rc 0
  mapfile -t lines <"$WORK/out"
  [ "${#lines[@]}" -eq 5 ] || fail "${#lines[@]} lines, expected 5"
  [[ ${lines[0]} =~ ^pid\ +[0-9]+$ ]] || fail "line '${lines[0]}'"
  [[ ${lines[1]} =~ ^descriptors\ +[0-9]+$ ]] || fail "line '${lines[1]}'"
  [[ ${lines[2]} =~ ^resident\ memory\ +[0-9]+\ kB$ ]] || fail "line '${lines[2]}'"
  [[ ${lines[3]} =~ ^virtual\ memory\ +[0-9]+\ kB$ ]] || fail "line '${lines[3]}'"
  total=$(awk '$1 == "MemTotal:" { print $2 }' /proc/meminfo)
  [ "${lines[4]}" = "total memory     $total kB" ] || fail "line '${lines[4]}'"
  # A sleeping process whose figures stay put while they are compared.
  sleep 30 >/dev/null 2>&1 9<&- &
  pid=$!
  PIDS+=("$pid")
  # Until it has started sleep, the child is a copy of this shell, with
  # the script's descriptor open as well.
  for ((i = 0; i < 250; i++)); do
    read -r comm <"/proc/$pid/comm" && [ "$comm" = sleep ] && break
    sleep 0.02
  done
  fds=(/proc/"$pid"/fd/*)
  status_rss=$(awk '$1 == "VmRSS:" { print $2 }' "/proc/$pid/status")
  status_vm=$(awk '$1 == "VmSize:" { print $2 }' "/proc/$pid/status")
  run stats --json "$pid"
  expect_rc 0
  if command -v jq >/dev/null; then
    [ "$(jq -c '[.pid, .descriptors, .rss_kb, .vmsize_kb, .mem_total_kb]' \
      "$WORK/out")" = "[$pid,${#fds[@]},$status_rss,$status_vm,$total]" ] ||
      fail "figures $(jq -c . "$WORK/out"), expected pid $pid, ${#fds[@]} descriptors, $status_rss/$status_vm kB, $total kB"
  else
    expect_out_has "\"pid\" : $pid"
    expect_out_has "\"descriptors\" : ${#fds[@]}"
  fi
  kill -KILL "$pid"
  wait "$pid" 2>/dev/null || true
  run stats "$pid"
  expect_one_error "quvaidx stats: no process $pid"
  run stats 2147483647
  expect_one_error "quvaidx stats: no process 2147483647"
  for args in "abc" "0" "-- -5" "1 2"; do
    # shellcheck disable=SC2086 # the arguments are split on purpose
    run stats $args
    expect_rc 2
    expect_no_out
    expect_err_has "Try 'quvaidx stats --help'."
  done
}

# --- The media-parser example daemon (examples/mediaparserd), run from
# $MEDIAPARSERD, and the tool's mediainfo and resolution commands.

# start_mediaparserd SOCKET NAME [OPTIONS...]: starts the daemon in the
# background with a pid file beside the socket unless OPTIONS name one,
# output in $WORK/NAME.out and .err, and waits for its "listening" line.
# Sets MP_PID.
start_mediaparserd() {
  local sock=$1 name=$2 i
  shift 2
  [ -x "${MEDIAPARSERD:-}" ] || fail "MEDIAPARSERD does not name the daemon"
  "$MEDIAPARSERD" --socket "$sock" "$@" >"$WORK/$name.out" 2>"$WORK/$name.err" &
  MP_PID=$!
  PIDS+=("$MP_PID")
  for ((i = 0; i < 250; i++)); do
    grep -qsF "mediaparserd: listening on $sock" "$WORK/$name.out" && return 0
    kill -0 "$MP_PID" 2>/dev/null || fail "mediaparserd exited: $(cat "$WORK/$name.err")"
    sleep 0.02
  done
  fail "mediaparserd did not report listening within 5 s"
}

# Sample files in the current directory: a real 3x2 PNG, a JPEG header
# (APP0, then SOF0 640x480), a GIF header (320x240), an MP3 with an ID3
# header, and a JPEG whose APP0 length runs past the end of the file.
make_media_samples() {
  python3 -c '
import struct, zlib
def chunk(kind, data):
    return struct.pack(">I", len(data)) + kind + data + struct.pack(">I", zlib.crc32(kind + data))
rows = b"".join(b"\0" + b"\x10\x20\x30" * 3 for _ in range(2))
open("tiny.png", "wb").write(b"\x89PNG\r\n\x1a\n"
    + chunk(b"IHDR", struct.pack(">IIBBBBB", 3, 2, 8, 2, 0, 0, 0))
    + chunk(b"IDAT", zlib.compress(rows)) + chunk(b"IEND", b""))'
  printf '\377\330\377\340\000\020JFIF\000\001\001\000\000\001\000\001\000\000\377\300\000\013\010\001\340\002\200\001\001\021\000\377\331' >photo.jpg
  printf 'GIF89a\100\001\360\000\000\000\000;' >anim.gif
  printf 'ID3\003\000\000\000\000\000\000\377\373\220\144' >song.mp3
  printf '\377\330\377\340\377\360JFIF' >broken.JPG
}

case_mediainfo() {
  local sock=$WORK/mp.sock size
  start_mediaparserd "$sock" mp --pidfile "$WORK/mp.pid"
  cd "$WORK"
  make_media_samples
  # Relative names are sent as absolute paths.
  run mediainfo --socket "$sock" --json tiny.png photo.jpg anim.gif song.mp3 \
    broken.JPG
  expect_rc 0
  [ -z "$ERR" ] || fail "stderr '$ERR'"
  if command -v jq >/dev/null; then
    local got expected="" f name table w h container
    got=$(jq -c '.[] | [.file, .table, .media.szPath, .media.szName,
      .media.resolutionX, .media.resolutionY, .media.fileSize,
      .media.szContainerType, (.media | length)]' "$WORK/out")
    for f in "tiny.png photo 3 2 image2" "photo.jpg photo 640 480 image2" \
      "anim.gif photo 320 240 gif" "song.mp3 music 0 0 mp3" \
      "broken.JPG photo 0 0 image2"; do
      read -r name table w h container <<<"$f"
      size=$(stat -c %s "$name")
      expected+="[\"$name\",\"$table\",\"$WORK/$name\",\"$name\",$w,$h,$size,\"$container\",47]"$'\n'
    done
    [ "$got" = "${expected%$'\n'}" ] || fail "records:
$got
expected:
${expected%$'\n'}"
    [ "$(jq -r '.[0].media.szMDate' "$WORK/out")" = \
      "$(date -r tiny.png '+%Y-%m-%d %H:%M:%S')" ] || fail "szMDate"
  else
    expect_out_has '"resolutionX" : 640'
    expect_out_has '"table" : "music"'
  fi
  run mediainfo --socket "$sock" "$WORK/photo.jpg"
  expect_rc 0
  expect_out_has "table:           photo"
  expect_out_has "szPath:          $WORK/photo.jpg"
  expect_out_has "resolutionX:     640"
  expect_out_has "resolutionY:     480"
  expect_out_has "fileSize:        35"
  expect_out_has "szContainerType: image2"
  grep -q "^szTitle:" "$WORK/out" && fail "an empty field was listed"
  run mediainfo --socket "$sock" --all song.mp3
  expect_rc 0
  expect_out_has "szTitle:         "
  [ "$(grep -c ':' "$WORK/out")" -eq 48 ] || fail "--all lists 48 lines"
  run resolution --socket "$sock" photo.jpg
  expect_rc 0
  expect_out "640x480"
  run resolution --socket "$sock" --json anim.gif
  expect_rc 0
  expect_out_has '"width" : 320'
  expect_out_has '"height" : 240'
  run resolution --socket "$sock" song.mp3
  expect_out "0x0"
  # The other requests a media parser answers.
  run send --socket "$sock" --compact \
    "{\"command\":\"GET_VIDEO_METADATA\",\"path\":\"$WORK/song.mp3\"}"
  expect_rc 0
  expect_out '{"metadata":{"par":{"height":0,"width":0},"rotation":0},"success":true}'
  run send --socket "$sock" --compact '{"command":"HANDSHAKE"}'
  expect_out '{"success":true}'
  run send --socket "$sock" --compact '{"command":"REINDEX"}'
  expect_rc 1
  expect_out '{"reason":"unknown command","success":false}'
}

case_mediainfo_errors() {
  local sock=$WORK/mp.sock
  start_mediaparserd "$sock" mp --pidfile "$WORK/mp.pid"
  cd "$WORK"
  make_media_samples
  mkfifo fifo.mp3
  mkdir album.png
  run mediainfo --socket "$sock" none.jpg
  expect_rc 1
  expect_no_out
  [ "$ERR" = "quvaidx mediainfo: none.jpg: No such file or directory" ] ||
    fail "stderr '$ERR'"
  # A FIFO must not block the daemon; a folder is no media file.
  run mediainfo --socket "$sock" fifo.mp3 album.png tiny.png
  expect_rc 1
  expect_err_has "quvaidx mediainfo: fifo.mp3: not a regular file"
  expect_err_has "quvaidx mediainfo: album.png: not a regular file"
  expect_out_has "resolutionX:     3"
  run resolution --socket "$sock" none.png
  expect_rc 1
  expect_err_has "quvaidx resolution: none.png: No such file or directory"
  run send --socket "$sock" --compact '{"command":"GET_MEDIA_INFO","path":"tiny.png"}'
  expect_rc 1
  expect_out '{"reason":"path is not absolute","success":false}'
  run send --socket "$sock" --compact '{"command":"GET_MEDIA_INFO","path":7}'
  expect_rc 1
  expect_out '{"reason":"missing \"path\"","success":false}'
  run mediainfo --socket "$sock"
  expect_rc 2
  expect_err_has "quvaidx mediainfo: missing FILE"
  run resolution --socket "$sock" tiny.png photo.jpg
  expect_rc 2
  expect_err_has "expects one FILE"
  run resolution --all --socket "$sock" tiny.png
  expect_rc 2
  run mediainfo --socket "$sock" --attempts 0 tiny.png
  expect_rc 2
  expect_err_has "--attempts needs a whole number"
  run mediainfo --help
  expect_rc 0
  expect_out_has "Usage: quvaidx mediainfo [OPTIONS] FILE..."
  run resolution --help
  expect_out_has "Usage: quvaidx resolution [OPTIONS] FILE"
  kill -0 "$MP_PID" || fail "the daemon died"
}

case_mediainfo_no_daemon() {
  local start=$SECONDS
  cd "$WORK"
  : >x.png
  run mediainfo --socket "$WORK/none.sock" --attempts 1 x.png
  expect_one_error "quvaidx mediainfo: no reply from the media parser on $WORK/none.sock after 1 attempt"
  run resolution --socket "$WORK/none.sock" --attempts 1 x.png
  expect_one_error "quvaidx resolution: no reply from the media parser"
  [ $((SECONDS - start)) -le 4 ] || fail "took $((SECONDS - start)) s"
}

case_mediaparserd_pidfile() {
  local sock=$WORK/mp.sock pid_file=$WORK/mp.pid i first
  start_mediaparserd "$sock" mp --pidfile "$pid_file"
  first=$MP_PID
  [ "$(cat "$pid_file")" = "$first" ] || fail "pid file holds $(cat "$pid_file")"
  # A second instance on the same pid file refuses to start.
  set +e
  timeout 5 "$MEDIAPARSERD" --socket "$WORK/other.sock" --pidfile "$pid_file" \
    >"$WORK/out" 2>"$WORK/err"
  RC=$?
  set -e
  expect_rc 1
  expect_out_has "Daemon alive. No need to start"
  [ ! -e "$WORK/other.sock" ] || fail "the second instance listened"
  kill -TERM "$first"
  wait "$first" || fail "exit status $? after SIGTERM"
  [ ! -e "$sock" ] && [ ! -e "$pid_file" ] || fail "socket or pid file left"
  # Detached: the pid file and the socket appear, the tool is answered,
  # SIGINT removes both.
  : >"$WORK/x.gif"
  "$MEDIAPARSERD" --socket "$sock" --pidfile "$pid_file" --daemon
  for ((i = 0; i < 250; i++)); do
    [ -s "$pid_file" ] && [ -S "$sock" ] && break
    sleep 0.02
  done
  [ -s "$pid_file" ] || fail "no pid file"
  PIDS+=("$(cat "$pid_file")")
  run resolution --socket "$sock" "$WORK/x.gif"
  expect_out "0x0"
  kill -INT "$(cat "$pid_file")"
  for ((i = 0; i < 250; i++)); do
    [ ! -e "$pid_file" ] && [ ! -e "$sock" ] && return 0
    sleep 0.02
  done
  fail "the detached daemon left its socket or pid file"
}

"case_$CASE"
echo "PASS [$CASE]"
