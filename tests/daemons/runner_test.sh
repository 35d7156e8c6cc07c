#!/usr/bin/env bash
# The common life of the reference daemons, on a sample daemon:
#   runner_test.sh SAMPLED QUVAIDX
# options and their errors, the pid file and a refused second instance,
# --stderr with --loglevel, the socket's mode and group, SIGTERM, a
# detached start with relative paths, the reasons a start fails, and a
# listening socket handed over as a service manager does. Everything lives
# in a private directory; every process started is ended by its pid.
set -euo pipefail
daemon=$1
tool=$2
work=$(mktemp -d /tmp/quvaidx-runner.XXXXXX)
export QUVA_HOST_ETC=$work/etc
pids=()
cleanup() {
  local pid
  for pid in "${pids[@]}"; do kill -KILL "$pid" 2>/dev/null || true; done
  for pid in "${pids[@]}"; do wait "$pid" 2>/dev/null || true; done
  [ -f "$work/d.pid" ] && kill -KILL "$(cat "$work/d.pid")" 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "FAIL: $*" >&2; for f in "$work"/*.out "$work"/*.err; do
  [ -f "$f" ] && { echo "--- $f"; cat "$f"; } >&2; done; exit 1; }
until_ok() {
  local i
  for ((i = 0; i < 250; i++)); do "$@" && return 0 || sleep 0.02; done
  return 1
}
send() { timeout 5 "$tool" send --attempts 1 --compact --socket "$@"; }

# Options: --version, --help and usage errors (exit 2).
[ "$("$daemon" --version)" = "sampled $("$tool" --version | cut -d' ' -f2)" ] ||
  fail "--version"
"$daemon" --help | grep -q -- '--socket-group GROUP' || fail "--help"
for bad in "--bogus" "--loglevel 8" "--socket-mode 0800" "--socket-group no-such-group-x" "extra"; do
  rc=0
  # shellcheck disable=SC2086
  "$daemon" $bad >"$work/bad.out" 2>"$work/bad.err" || rc=$?
  [ "$rc" -eq 2 ] && grep -q "Try 'sampled --help'" "$work/bad.err" ||
    fail "'$bad' gave $rc: $(cat "$work/bad.err")"
done

# In the foreground: the pid file, the start hook, a refused second
# instance, log lines on stderr, the socket's mode and group.
group=$(id -g)
"$daemon" --foreground --socket "$work/d.sock" --pidfile "$work/d.pid" \
  --marks "$work/marks" --stderr --loglevel 6 --socket-mode 0600 \
  --socket-group "$group" >"$work/d.out" 2>"$work/d.err" &
pid=$!
pids+=("$pid")
until_ok grep -qsF "sampled: listening on $work/d.sock" "$work/d.out" ||
  fail "no listening line"
[ "$(cat "$work/d.pid")" = "$pid" ] || fail "pid file holds $(cat "$work/d.pid")"
[ "$(stat -c '%a %g' "$work/d.sock")" = "600 $group" ] ||
  fail "socket is $(stat -c '%a %g' "$work/d.sock")"
[ "$(send "$work/d.sock" '{"command":"PING"}')" = '{"success":true}' ] ||
  fail "no reply"
until_ok grep -q "request PING" "$work/d.err" || fail "no log line on stderr"
rc=0
"$daemon" --foreground --socket "$work/e.sock" --pidfile "$work/d.pid" \
  >"$work/second.out" 2>"$work/second.err" || rc=$?
[ "$rc" -eq 1 ] && grep -qx "Daemon alive. No need to start" "$work/second.out" ||
  fail "second instance: exit $rc"
[ ! -e "$work/e.sock" ] && [ "$(cat "$work/d.pid")" = "$pid" ] ||
  fail "the refused instance made a socket or took the pid file"

# SIGTERM: the stop hook runs, socket and pid file go, exit 0.
kill -TERM "$pid"
rc=0
wait "$pid" || rc=$?
[ "$rc" -eq 0 ] || fail "exit $rc after SIGTERM"
[ "$(tr '\n' ' ' <"$work/marks")" = "start stop " ] || fail "marks: $(cat "$work/marks")"
[ ! -e "$work/d.sock" ] && [ ! -e "$work/d.pid" ] || fail "socket or pid file left"

# Detached (the default), with relative paths: it works from "/", so they
# are made absolute first.
(cd "$work" && "$daemon" --socket d.sock --pidfile d.pid >"$work/bg.out" 2>&1) ||
  fail "the detaching start failed: $(cat "$work/bg.out")"
until_ok test -S "$work/d.sock" || fail "no socket after detaching"
until_ok test -s "$work/d.pid" || fail "no pid file after detaching"
[ "$(send "$work/d.sock" '{}')" = '{"success":true}' ] || fail "detached: no reply"
[ ! -s "$work/bg.out" ] || fail "the detached daemon printed: $(cat "$work/bg.out")"
detached=$(cat "$work/d.pid")
kill -TERM "$detached"
until_ok test ! -e "$work/d.pid" || fail "the detached daemon left its pid file"

# A start that fails says why on stderr, with the system's words, whatever
# the system log does; log lines name no removal that was not tried.
: >"$work/file"
python3 -c 'import socket, sys, time
s = socket.socket(socket.AF_UNIX); s.bind(sys.argv[1]); s.listen(1)
print("up", flush=True); time.sleep(20)' "$work/live.sock" >"$work/live.out" &
pids+=("$!")
until_ok grep -qs up "$work/live.out" || fail "no live socket"
while IFS='|' read -r sock reason; do
  rc=0
  "$daemon" --foreground --stderr --socket "$sock" --pidfile "$work/f.pid" \
    >"$work/f.out" 2>"$work/f.err" || rc=$?
  [ "$rc" -eq 1 ] && grep -qxF "sampled: cannot listen on $sock: $reason" "$work/f.err" ||
    fail "listening on $sock: exit $rc"
  ! grep -q '\[Error\] remove' "$work/f.err" || fail "a removal was claimed"
  [ ! -e "$work/f.pid" ] || fail "the pid file stayed after a failed start"
done <<EOF_CASES
$work/file|File exists (not a socket; it was left alone)
$work/live.sock|Address already in use (another process answers there)
$work/none/d.sock|No such file or directory
EOF_CASES
[ -f "$work/file" ] && [ -S "$work/live.sock" ] || fail "a path was not left alone"

# handed SOCKET PID ARGS...: runs the daemon in the foreground with a
# listening socket bound at SOCKET as descriptor 3, LISTEN_FDS=1 and
# LISTEN_PID=PID ("self": its own), as a service manager hands one over.
handed() {
  local bound=$1 pid=$2
  shift 2
  python3 -c 'import os, socket, sys
s = socket.socket(socket.AF_UNIX); s.bind(sys.argv[1]); s.listen(16)
os.dup2(s.fileno(), 3); os.set_inheritable(3, True)
pid = str(os.getpid()) if sys.argv[2] == "self" else sys.argv[2]
os.execve(sys.argv[3], sys.argv[3:],
          dict(os.environ, LISTEN_PID=pid, LISTEN_FDS="1"))' \
    "$bound" "$pid" "$daemon" --foreground --pidfile "$work/h.pid" "$@" \
    >"$work/h.out" 2>"$work/h.err" &
  pids+=("$!")
  hpid=$!
}
# Served, and the socket file stays the manager's after the daemon stops.
handed "$work/h.sock" self --socket "$work/h.sock"
until_ok grep -qs "listening on $work/h.sock" "$work/h.out" || fail "handed: not listening"
[ "$(send "$work/h.sock" '{}')" = '{"success":true}' ] || fail "handed: no reply"
kill -TERM "$hpid"
wait "$hpid" || fail "handed: exit $? after SIGTERM"
[ -S "$work/h.sock" ] || fail "the handed socket's file was removed"
# A socket bound elsewhere is refused, with its reason.
rm -f "$work/h.sock"
handed "$work/h.sock" self --socket "$work/other.sock"
rc=0
wait "$hpid" || rc=$?
[ "$rc" -eq 1 ] && grep -qF "sampled: cannot serve the socket handed over (fd 3) for $work/other.sock: " "$work/h.err" ||
  fail "a socket bound elsewhere: exit $rc"
[ ! -e "$work/other.sock" ] || fail "the daemon bound a socket of its own"
# Variables meant for another process are not taken: it binds its own.
rm -f "$work/h.sock"
handed "$work/h.sock" 1 --socket "$work/own.sock"
until_ok grep -qs "listening on $work/own.sock" "$work/h.out" || fail "own: not listening"
kill -TERM "$hpid"
wait "$hpid" || fail "own: exit $? after SIGTERM"
[ ! -e "$work/own.sock" ] || fail "its own socket was not removed"
echo "daemon runner check passed"
