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
  done
  for command in daemons taskq; do
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

"case_$CASE"
echo "PASS [$CASE]"
