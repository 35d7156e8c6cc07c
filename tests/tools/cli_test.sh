#!/usr/bin/env bash
# End-to-end checks of the quvaidx tool: cli_test.sh TOOL CASE. On exit a case
# kills every process it started, deletes every task queue it created and
# removes its temporary directory. Each tool run is bounded by `timeout`.
set -euo pipefail

TOOL=$1
CASE=$2
# Socket paths hold at most 107 bytes, so the directory lives in /tmp.
WORK=$(mktemp -d /tmp/quvaidx-cli.XXXXXX)
PIDS=()
QUEUES=() # "KEYFILE PROJECT ID" of each queue created
AS=()     # a prefix for the tool's command line (another user)
# An empty host state directory: the machine counts as booted.
export QUVA_HOST_ETC=$WORK/host-etc

cleanup() {
  local pid key project id
  for pid in "${PIDS[@]}"; do kill -KILL "$pid" 2>/dev/null || true; done
  for pid in "${PIDS[@]}"; do wait "$pid" 2>/dev/null || true; done
  for id in "${QUEUES[@]}"; do
    read -r key project id <<<"$id"
    timeout 5 "$TOOL" taskq delete "$key" "$project" >/dev/null 2>&1 || true
    ipcrm -q "$id" >/dev/null 2>&1 || true # should the tool have failed
  done
  chmod -R u+rwx "$WORK" 2>/dev/null || true
  rm -rf "$WORK"
}
trap cleanup EXIT

fail() {
  { echo "FAIL [$CASE]: $*"; echo "--- last stdout:"; cat "$WORK/out"
    echo "--- last stderr:"; cat "$WORK/err"; } >&2 2>/dev/null
  exit 1
}

# run ARGS...: runs the tool; sets RC, OUT and ERR.
run() {
  RC=0
  timeout 5 "${AS[@]}" "${AS_TOOL:-$TOOL}" "$@" >"$WORK/out" 2>"$WORK/err" ||
    RC=$?
  OUT=$(<"$WORK/out") ERR=$(<"$WORK/err")
}
# as_nobody: later runs are made as user nobody (the caller is root), until
# as_self. The build tree may lie where nobody cannot go: the tool and the
# project's libraries are then copied into $WORK, which nobody may enter.
as_nobody() {
  local lib
  chmod 755 "$WORK"
  AS=(setpriv --reuid=65534 --regid=65534 --clear-groups)
  AS_TOOL=""
  "${AS[@]}" "$TOOL" --version >/dev/null 2>&1 && return 0
  mkdir -p "$WORK/nobody"
  cp "$TOOL" "$WORK/nobody/"
  for lib in $(ldd "$TOOL" | awk '/libquva/ { print $3 }'); do
    cp "$lib" "$WORK/nobody/"
  done
  chmod -R a+rX "$WORK/nobody"
  AS=(env "LD_LIBRARY_PATH=$WORK/nobody" "${AS[@]}")
  AS_TOOL=$WORK/nobody/$(basename "$TOOL")
}
as_self() {
  AS=()
  AS_TOOL=""
  chmod 700 "$WORK"
}

# expect RC [STDOUT]: the exit status, and stdout when given.
expect() {
  [ "$RC" -eq "$1" ] || fail "exit status $RC, expected $1"
  [ $# -lt 2 ] || [ "$OUT" = "$2" ] || fail "stdout '$OUT', expected '$2'"
}
# expect_error TEXT [RC]: nothing on stdout, one stderr line starting with
# TEXT (and the hint to ask for --help after a usage error), exit status RC
# (2).
expect_error() {
  local line=${ERR%$'\n'Try \'quvaidx*\'.}
  expect "${2:-2}" ""
  [[ $line != *$'\n'* && $line == "$1"* ]] ||
    fail "stderr '$ERR', expected one line starting with '$1'"
}
# t RC TEXT ARGS...: one row of a table: runs the tool with ARGS; with RC 0
# it must print TEXT ("*": anything) and nothing on stderr, otherwise
# nothing on stdout and one stderr line starting with TEXT.
t() {
  local rc=$1 text=$2
  shift 2
  run "$@"
  if [ "$rc" -ne 0 ]; then expect_error "$text" "$rc"; return; fi
  expect 0
  [ "$text" = "*" ] || [ "$OUT" = "$text" ] || fail "stdout '$OUT', expected '$text'"
  [ -z "$ERR" ] || fail "stderr '$ERR'"
}
# has out|err TEXT...: the last run printed each TEXT there.
has() {
  local where=$1 text
  shift
  for text; do grep -qF -- "$text" "$WORK/$where" || fail "$where lacks '$text'"; done
}
# expect_file FILE TEXT: FILE holds exactly TEXT (a printf format).
expect_file() {
  printf -- "$2" >"$WORK/expected"
  cmp -s "$1" "$WORK/expected" || fail "$1 holds '$(cat "$1")'"
}
# expect_entries QUEUE TEXT: the queue's lines, less the empty lines that
# finished entries become, are TEXT.
expect_entries() {
  printf -- "$2" >"$WORK/expected"
  sed '/^$/d' "$1" | cmp -s - "$WORK/expected" ||
    fail "$1 holds the entries '$(sed '/^$/d' "$1")'"
}
# json EXPR [ARGS...]: the Python expression EXPR holds, with d the JSON on
# stdout and A the ARGS; flat(v) lists the whole numbers in v as "path=N".
json() {
  python3 - "$WORK/out" "$@" <<'PY' || fail "JSON check: $1"
import json, os, sys
def flat(v, p=""):
    if isinstance(v, dict):
        return sorted(x for k, i in v.items() for x in flat(i, p + k + "."))
    return [p[:-1] + "=" + str(v)] if type(v) is int else []
d = json.load(open(sys.argv[1])); A = sys.argv[3:]
sys.exit(0 if eval("(" + sys.argv[2] + ")") else "got " + json.dumps(d))
PY
}

# until_ok CMD...: retries CMD for up to 5 s.
until_ok() {
  local i
  for ((i = 0; i < 250; i++)); do "$@" && return 0 || sleep 0.02; done
  return 1
}
# gone PID: the process has ended (a zombie counts).
gone() { ! grep -qs '^.*) [^Z] ' "/proc/$1/stat"; }
# start NAME LINE CMD...: runs CMD in the background, output in $WORK/NAME.out
# and .err, and waits for LINE on its stdout. Sets BG.
start() {
  local name=$1 line=$2
  shift 2
  "$@" >"$WORK/$name.out" 2>"$WORK/$name.err" &
  BG=$!
  PIDS+=("$BG")
  until_ok grep -qsF "$line" "$WORK/$name.out" ||
    fail "$name did not print '$line': $(cat "$WORK/$name.err")"
}
# peer NAME SOCKET [USER]: a process that listens on SOCKET (mode 0666),
# accepts every connection and never answers, printing "received" when a
# request arrives; run as USER (default: this one) for 20 s at most.
peer() {
  local as=()
  [ -z "${3:-}" ] || as=(setpriv "--reuid=$3" "--regid=$3" --clear-groups)
  start "$1" up "${as[@]}" /usr/bin/python3 -c 'import os, select, socket, sys, time
os.umask(0); s = socket.socket(socket.AF_UNIX); s.bind(sys.argv[1]); s.listen(16)
print("up", flush=True); conns = [s]; end = time.time() + 20
while time.time() < end:
    for c in select.select(conns, [], [], 0.5)[0]:
        if c is s: conns.append(s.accept()[0])
        elif c.recv(65536): print("received", flush=True)
        else: conns.remove(c); c.close()' "$2"
}
# serve SOCKET [OPTIONS...]: starts `quvaidx serve`.
serve() {
  start serve "quvaidx serve: listening on $1" "$TOOL" serve --socket "$@"
}
# stop SIGNAL FILE...: signals `quvaidx serve` (process BG), which must end
# with status 0, say why on stdout, and leave none of the FILEs behind.
stop() {
  local sig=$1 rc=0 file
  shift
  kill -"$sig" "$BG"
  until_ok gone "$BG" || fail "process $BG ignored SIG$sig"
  wait "$BG" || rc=$?
  [ "$rc" -eq 0 ] || fail "exit status $rc after SIG$sig"
  for file; do [ ! -e "$file" ] || fail "$file left behind"; done
  has serve.out "quvaidx serve: stopped by SIG$sig"
}

case_serve_send() {
  local sock=$WORK/d.sock request
  run bogus; expect 2 ""
  [ "$ERR" = $'quvaidx: unknown command \'bogus\'\nTry \'quvaidx --help\'.' ] ||
    fail "stderr '$ERR'"
  serve "$sock" --verbose
  # With --handshake the daemon sees two requests: the handshake and ours.
  t 0 '{"success":true}' send --socket "$sock" --handshake --compact '{"command":"HANDSHAKE"}'
  t 0 '{"echo":{"command":"ECHO","n":[1,2],"s":"x"},"success":true}' \
    send -s "$sock" -c '{"command":"ECHO","n":[1,2],"s":"x"}'
  t 0 '*' send -s "$sock" '{"command":"ECHO"}' # indented without --compact
  [ "$(wc -l <"$WORK/out")" -gt 3 ] || fail "reply not indented"
  # A request the daemon refuses: exit status 1, its reply on stdout.
  run send -s "$sock" -c '{"command":"NOPE"}'
  expect 1 '{"reason":"unknown command","success":false}'
  # Requests refused before sending.
  for request in '{"command":' '{} x' '' '{"a":1,}' '{"a":1,"a":2}' \
    '{"a":1} // c' "$(printf '%*s' 5000 '' | tr ' ' '[')"; do
    t 2 "quvaidx send: invalid JSON request: " send -s "$sock" "$request"
  done
  t 2 "quvaidx send: the request must be a JSON object" send -s "$sock" '[1]'
  t 2 "quvaidx send: the request is 20028 bytes long; a packet carries at most 16380" \
    send -s "$sock" "{\"command\":\"ECHO\",\"big\":\"$(printf '%*s' 20000 '' | tr ' ' x)\"}"
  # The request from standard input ("-" or none); the reply in raw UTF-8
  # with numbers in their shortest exact form.
  t 0 '{"echo":{"command":"ECHO","s":"héllo","x":0.1},"success":true}' \
    send -s "$sock" -c - <<<'{"command":"ECHO","s":"h\u00e9llo","x":0.1}'
  # Earlier clients have closed, and the refused requests never arrived.
  t 0 '{"connections":1,"requests":7,"success":true}' send -s "$sock" -c '{"command":"STATS"}'
  # A second daemon is refused on a live socket and on a regular file.
  echo keep >"$WORK/file"
  t 2 "quvaidx serve: a daemon is already listening on $sock" serve -s "$sock"
  t 2 "quvaidx serve: $WORK/file exists and is not a socket" serve -s "$WORK/file"
  t 2 "quvaidx serve: cannot listen on $WORK/none/d.sock: No such file or directory" \
    serve -s "$WORK/none/d.sock"
  [ "$(cat "$WORK/file")" = keep ] || fail "the file was changed"
  stop TERM "$sock"
  # --verbose: the library's debug lines reach stderr.
  grep -qF "[quvaidx-serve] BEV_EVENT_EOF" "$WORK/serve.err" ||
    fail "no library log line on the daemon's stderr"
}

# Every command that waits for a daemon says why it got no answer, names
# the daemon and its socket, and waits no longer than --timeout.
case_connect() {
  local sock long command started reason
  sock=$WORK/$(printf '%*s' $((106 - ${#WORK})) '' | tr ' ' p) # 107 bytes
  t 2 "quvaidx send: socket path is 108 bytes long; a Unix-domain socket path holds at most 107" \
    send -s "${sock}q" '{}'
  t 2 "quvaidx serve: socket path is 108 bytes long" serve -s "${sock}q"
  [ ! -e "${sock}q" ] || fail "a socket file was created"
  # A daemon killed outright leaves its socket, where nobody answers; a
  # new one replaces it, works on a path of 107 bytes, and stops on SIGINT.
  serve "$sock"
  kill -KILL "$BG"
  wait "$BG" 2>/dev/null || true
  [ -S "$sock" ] || fail "the killed daemon's socket is gone"
  ln -s "$sock" "$WORK/stale.sock"
  : >"$WORK/plain"
  chmod 755 "$WORK"
  mkdir -m 777 "$WORK/public"
  peer mute "$WORK/mute.sock"
  peer squatter "$WORK/public/squat.sock" 65534
  for command in send mediainfo resolution sizemap; do
    local args=(--attempts 3 --timeout 0.3 "$WORK") daemon=quvamediaparserd
    [ "$command" = send ] && args[4]='{}' daemon="the daemon"
    [ "$command" = sizemap ] && daemon=quvaindexplugind
    while IFS='|' read -r path reason; do
      started=$(date +%s%N)
      run "$command" --socket "$path" "${args[@]}"
      expect_error "quvaidx $command: $reason" 2
      (( ($(date +%s%N) - started) / 1000000 < 900 )) || fail "$command waited too long"
    done <<EOF
$WORK/none|cannot reach $daemon on $WORK/none: no such socket (1 attempt)
$WORK/plain|cannot reach $daemon on $WORK/plain: not a socket (1 attempt)
$WORK/stale.sock|cannot reach $daemon on $WORK/stale.sock: connection refused (nobody listens there) (1 attempt)
$WORK/public/squat.sock|cannot reach $daemon on $WORK/public/squat.sock: answered by user nobody, not root or you; nothing was sent (1 attempt)
$WORK/mute.sock|$daemon on $WORK/mute.sock sent no reply to the request within 0.3 s
EOF
  done
  ! grep -q received "$WORK/squatter.out" || fail "the squatter was sent a request"
  # Attempts are a second apart while the time limit allows another.
  started=$(date +%s%N)
  t 2 "quvaidx send: cannot reach the daemon on $WORK/none: no such socket (2 attempts)" \
    send --socket "$WORK/none" --attempts 2 '{}'
  (( ($(date +%s%N) - started) / 1000000 >= 1000 )) || fail "attempts without a wait"
  # A new daemon replaces the stale socket; as another user, permission
  # to root's own socket is denied.
  serve "$sock"
  chmod 600 "$sock"
  as_nobody
  t 2 "quvaidx send: cannot reach the daemon on $sock: permission denied (1 attempt)" \
    send -s "$sock" '{}'
  as_self
  t 0 '{"success":true}' send -s "$sock" -c '{"command":"HANDSHAKE"}'
  stop INT "$sock"
  [ ! -s "$WORK/serve.err" ] || fail "serve wrote to stderr"
}

# The daemon directory as `quvaidx daemons` shows it where none runs.
DAEMONS="NAME      ALIVE  PID  PID FILE                       EXECUTABLE                       SOCKET
controld  no     -    /var/run/quvaindexd.pid        /usr/quva/sbin/quvaindexd        /tmp/quvaindexd_sock
scand     no     -    /var/run/quvaindexscand.pid    /usr/quva/sbin/quvaindexscand    /tmp/quvaindexscand_sock
workerd   no     -    /var/run/quvaindexworkerd.pid  /usr/quva/sbin/quvaindexworkerd  /tmp/quvaindexworkerd_sock
plugind   no     -    /var/run/quvaindexplugind.pid  /usr/quva/sbin/quvaindexplugind  /tmp/quvaindexplugind_sock
mediad    no     -    /var/run/quvamediaparserd.pid  /usr/quva/sbin/quvamediaparserd  /tmp/quvamediaparserd_sock"
UNKNOWN="unknown daemon 'nosuchd'; known daemons: controld, scand, workerd, plugind, mediad"

case_daemons() {
  t 0 "*" daemons
  # Nothing runs the index daemons on a test machine; a live one's row
  # would show its pid.
  local none_alive=""
  [ -n "$(ls /var/run/quvaindex*.pid /var/run/quvamediaparserd.pid 2>/dev/null)" ] ||
    none_alive=yes
  [ -z "$none_alive" ] || [ "$OUT" = "$DAEMONS" ] || fail "not the daemon table"
  t 0 "*" daemons --json
  json '[[e["name"], e["pid_file"], e["executable"], e["socket"]] for e in d]
    == [[r[0]] + r[3:] for r in map(str.split, A[0].splitlines()[1:])]
    and all(e["alive"] is False and e["pid"] is None for e in d
    if not os.path.exists(e["pid_file"]))' "$DAEMONS"
  # Asked by name, as `systemctl is-active`: 3 when one is not alive.
  run daemons mediad scand
  [ -z "$none_alive" ] || expect 3
  [ "$(awk 'NR > 1 { print $1 }' "$WORK/out" | tr '\n' ' ')" = "mediad scand " ] ||
    fail "not the rows asked for, in their order"
  t 2 "quvaidx daemons: $UNKNOWN" daemons nosuchd
  t 2 "quvaidx send: $UNKNOWN" send --daemon nosuchd '{"command":"HANDSHAKE"}'
  # A known name resolves to the directory's socket.
  if [ ! -e /tmp/quvaindexd_sock ]; then
    t 2 "quvaidx send: cannot reach quvaindexd on /tmp/quvaindexd_sock: no such socket" \
      send --daemon controld --attempts 1 '{"command":"HANDSHAKE"}'
  fi
}

# new_queue KEYFILE PROJECT: creates the key file and a queue deleted on exit.
new_queue() {
  : >"$1"
  t 0 "*" taskq create "$1" "$2"
  [[ $OUT =~ ^[0-9]+$ ]] || fail "create printed '$OUT', not an identifier"
  QUEUES+=("$1 $2 $OUT")
}

case_taskq() {
  local key=$WORK/q.key big pid started
  t 2 "quvaidx taskq: key file $WORK/none.key: No such file or directory" \
    taskq create "$WORK/none.key" 7
  new_queue "$key" 7
  t 0 "" taskq push "$key" 7 '{"n":1}'
  t 0 "" taskq push "$key" 7 --type 2 - <<<'{"s":"two","n":2}'
  t 0 2 taskq count "$key" 7
  t 0 '{"n":2,"s":"two"}' taskq pop "$key" 7 --type 2 # though pushed last
  t 0 '{"n":1}' taskq pop "$key" 7
  t 2 "quvaidx taskq: invalid JSON task: " taskq push "$key" 7 '{"a":1'
  t 2 "quvaidx taskq: --size does not apply to push" taskq push "$key" 7 --size 4 '{}'
  # The largest task a queue carries: 8191 bytes with its line end.
  big=$(printf '%*s' 8182 '' | tr ' ' x)
  t 2 "quvaidx taskq: the task is 8192 bytes long; a queue carries at most 8191" \
    taskq push "$key" 7 "{\"a\":\"${big}y\"}"
  t 0 "" taskq push "$key" 7 "{\"a\":\"$big\"}"
  t 0 "{\"a\":\"$big\"}" taskq pop "$key" 7 --nowait
  # A blocking pop waits for the next push.
  timeout 5 "$TOOL" taskq pop "$key" 7 >"$WORK/wait.out" 2>&1 &
  pid=$!
  PIDS+=("$pid")
  sleep 0.2
  kill -0 "$pid" 2>/dev/null || fail "the blocking pop did not wait"
  t 0 "" taskq push "$key" 7 --type 5 '{"late":true}'
  wait "$pid" && [ "$(cat "$WORK/wait.out")" = '{"late":true}' ] ||
    fail "the blocking pop: $(cat "$WORK/wait.out")"
  # Empty: the tool does not wait after its last attempt.
  started=$(date +%s%N)
  t 1 "quvaidx taskq: no task of type 0 after 1 attempt" taskq pop "$key" 7 -n -a 1
  (( ($(date +%s%N) - started) / 1000000 < 800 )) ||
    fail "an empty --nowait pop waited after its last attempt"
  # create discards what the queue held; delete removes it.
  t 0 "" taskq push "$key" 7 '{"old":1}'
  new_queue "$key" 7
  t 0 0 taskq count "$key" 7
  t 0 "" taskq delete "$key" 7
  t 2 "quvaidx taskq: no queue for key file $key, project 7" taskq pop "$key" 7 --nowait
  t 0 "" taskq delete "$key" 7
}

case_serve_pidfile() {
  local sock=$WORK/d.sock pid_file=$WORK/d.pid opt pid
  printf 4000000 >"$pid_file" # names no process: no obstacle
  serve "$sock" --pidfile "$pid_file"
  [ "$(cat "$pid_file")" = "$BG" ] || fail "pid file holds '$(cat "$pid_file")'"
  # A second instance on the pid file refuses, detached or not.
  for opt in "" --daemon; do
    run serve --socket "$WORK/b.sock" --pidfile "$pid_file" ${opt:+"$opt"}
    expect 2 "Daemon alive. No need to start"
    [ ! -e "$WORK/b.sock" ] && [ "$(cat "$pid_file")" = "$BG" ] ||
      fail "the refused daemon made its socket or changed the pid file"
  done
  stop TERM "$pid_file" "$sock"
  # --daemon: what the detached process could not report is found first.
  t 2 "quvaidx serve: cannot create the pid file $WORK/none/d.pid: $WORK/none: No such file or directory" \
    serve --daemon --pidfile "$WORK/none/d.pid" --socket "$sock"
  t 2 "quvaidx serve: cannot create the socket $WORK/none/d.sock: $WORK/none: No such file or directory" \
    serve --daemon --pidfile "$pid_file" --socket "$WORK/none/d.sock"
  # Relative paths hold, though the detached daemon works in "/".
  cd "$WORK"
  t 0 "" serve --daemon --pidfile d.pid --socket d.sock
  until_ok test -s d.pid -a -S d.sock || fail "no pid file or socket"
  pid=$(cat d.pid)
  PIDS+=("$pid")
  t 0 '{"success":true}' send -s d.sock -c '{"command":"HANDSHAKE"}'
  kill -TERM "$pid"
  until_ok gone "$pid" || fail "the daemon ignored SIGTERM"
  [ ! -e d.pid ] && [ ! -e d.sock ] || fail "pid file or socket left behind"
}

# make_tree DIR: a sample share: media of every table, upper-case
# extensions, names the index skips, symbolic links (one a loop), a pipe.
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
TREE_COUNTS="folders=7 skipped.app_bundle=1 skipped.apple_double=2
skipped.loop=0 skipped.metadata_folder=1 skipped.other_name=0
skipped.recycle_bin=1 skipped.remote_or_image_mount=0 skipped.snapshot=1
skipped.special=1 skipped.symlink=2 skipped.under_recycle_bin=0
skipped_total=9 tables.music=2 tables.other=3 tables.photo=7
tables.playlist=1 tables.video=4 thumbnails.folders=4 thumbnails.photos=6
total_files=17 unreadable_folders=0 web_conversion_photos=5 web_video=2"

# tree_list ROOT: the --list lines of make_tree's sample, sorted.
tree_list() {
  local t
  for t in music:Music/{SONG.MP3,b.flac} playlist:Music/list.m3u \
    video:Video/{a.mp4,b.mkv,C.AVI,d.srt} \
    photo:{Photos/{IMG.JPG,b.png,c.gif,d.psd,raw/e.NEF},.hidden.jpg,a/f.jpg} \
    other:{notes.txt,noext,album.old/track}; do
    printf '%s\t%s\n' "${t%%:*}" "$1/${t#*:}"
  done | LC_ALL=C sort
}

# expect_counts COUNTS: the numbers in the JSON summary on stdout.
expect_counts() {
  json 'flat({k: v for k, v in d.items() if k != "elapsed_seconds"})
    == A[0].split()' "$1"
}

case_scan() {
  local root list odd
  make_tree "$WORK/tree"
  root=$(cd -P "$WORK/tree" && pwd)
  mapfile -t list < <(tree_list "$root")
  t 0 '*' scan --json "$WORK/tree"
  expect_counts "$TREE_COUNTS"
  json 'd["roots"] == A and "files" not in d and d["elapsed_seconds"] >= 0' "$root"
  # With --list, the list goes to stdout and the summary to stderr; the
  # DIRs may come from standard input.
  run scan --list - <<<"$WORK/tree"; expect 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(tree_list "$root")" ] || fail "list"
  has err "Scanned 7 folders and 17 files in " "Skipped 9 entries:" \
    "  photo            7   6 need thumbnails, in 4 folders; 5 converted for the web" \
    "  symbolic links (never followed)                 2"
  t 0 '*' scan --json --list "$WORK/tree"
  expect_counts "$TREE_COUNTS"
  json 'sorted(f["table"] + "\t" + f["path"] for f in d["files"]) == A' "${list[@]}"
  # Every DIR is checked before anything is scanned.
  run scan --json "$WORK/tree" "$WORK/none" "$WORK/tree/notes.txt"; expect 2 ""
  [ "$ERR" = "quvaidx scan: $WORK/none: No such file or directory
quvaidx scan: $WORK/tree/notes.txt: not a folder" ] || fail "stderr"
  # Tabs, line feeds and backslashes in names are escaped in the list.
  mkdir "$WORK/odd"
  odd=$(cd -P "$WORK/odd" && pwd)
  touch "$odd/"$'tab\tname.mp3' "$odd/"$'new\nline.jpg' "$odd/back\\slash.png"
  run scan --list "$WORK/odd"; expect 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(printf '%s\n' "music	$odd/tab\\tname.mp3" \
    "photo	$odd/back\\\\slash.png" "photo	$odd/new\\nline.jpg")" ] || fail "escapes"
  # An unreadable folder: reported, and the rest is scanned. Root reads any
  # folder, so it scans as nobody, who needs a way into $WORK.
  mkdir -p "$WORK/tree/locked/inner"
  touch "$WORK/tree/locked/inner/x.mp3" "$WORK/tree/locked/y.jpg"
  chmod 000 "$WORK/tree/locked"
  [ "$(id -u)" -ne 0 ] || as_nobody
  run scan --json "$WORK/tree"
  as_self
  chmod 755 "$WORK/tree/locked"
  [ "$ERR" = "quvaidx scan: cannot read $root/locked: Permission denied" ] ||
    fail "stderr '$ERR'"
  expect 1
  expect_counts "${TREE_COUNTS/unreadable_folders=0/unreadable_folders=1}"
}

# preview_daemon: a stand-in for the preview daemon of pid file
# $WORK/previewd.pid, which appends "woke" to $WORK/woke on SIGUSR1.
preview_daemon() {
  start previewd up python3 -c 'import signal, sys, time
signal.signal(signal.SIGUSR1, lambda *a: open(sys.argv[1], "a").write("woke\n"))
print("up", flush=True); time.sleep(20)' "$WORK/woke"
  echo "$BG" >"$WORK/previewd.pid"
  PREVIEW=(--queue "$WORK/q" --pidfile "$WORK/previewd.pid")
}

# Folders outside every share, names the queue cannot carry and files of no
# interest are refused, each with its reason, and never stop the others.
case_thumb() {
  local share out real
  mkdir -p "$WORK/share/a" "$WORK/share/"$'new\nline' "$WORK/outside" "$QUVA_HOST_ETC"
  share=$(cd -P "$WORK/share" && pwd)
  out=$(cd -P "$WORK/outside" && pwd)
  printf '[photos]\npath = %s\n' "$share" >"$QUVA_HOST_ETC/shares.conf"
  touch "$share/a/x.jpg" "$share/a/song.mp3" "$share/"$'new\nline/y.jpg' \
    "$share/clip.mp4" "$out/z.jpg"
  mkfifo "$share/fifo"
  # Without a running daemon nothing is queued.
  t 2 "quvaidx thumb: the thumbnail daemon (quvamkthumbd) is not running: $WORK/none.pid names no live process; nothing was queued" \
    thumb --queue "$WORK/q" --pidfile "$WORK/none.pid" "$share"
  t 2 "quvaidx scan: the thumbnail daemon (quvamkthumbd) is not running" \
    scan --queue-thumbs --queue "$WORK/q" --pidfile "$WORK/none.pid" "$share"
  [ ! -e "$WORK/q" ] || fail "a queue was written"
  preview_daemon
  # Each path: what was queued, or why not.
  run thumb "${PREVIEW[@]}" -0 - < <(printf '%s\0' "$share/a/x.jpg" "$share" \
    "$share/a/song.mp3" "$out/z.jpg" "$share/"$'new\nline/y.jpg' "$share/fifo" "$WORK/none")
  expect 1 "queued $share/a (the folder of x.jpg) for quvamkthumbd
queued $share for quvamkthumbd"
  [ "$ERR" = "quvaidx thumb: not queued: $share/a/song.mp3: not a web photo
quvaidx thumb: not queued: $out/z.jpg: $out is outside every share
quvaidx thumb: not queued: $share/"$'new\nline/y.jpg'": the name holds a line feed, which a queue line cannot carry
quvaidx thumb: not queued: $share/fifo: neither a directory nor a regular file
quvaidx thumb: $WORK/none: No such file or directory" ] || fail "stderr '$ERR'"
  expect_file "$WORK/q" "$share/a\n$share\n"
  until_ok grep -qx woke "$WORK/woke" || fail "the daemon was not woken"
  [ "$(wc -l <"$WORK/woke")" -eq 1 ] || fail "woken more than once"
  t 1 "quvaidx thumb: not queued: $share/a/song.mp3: not a web photo" \
    thumb "${PREVIEW[@]}" "$share/a/song.mp3"
  t 0 "queued $share/clip.mp4 for quvamkflvd" thumb --video "${PREVIEW[@]}" "$share/clip.mp4"
  # scan --queue-thumbs: the refused folders are reported; the others queued.
  rm "$WORK/q"
  run scan --queue-thumbs --json "${PREVIEW[@]}" "$WORK/share" "$WORK/outside"
  expect 1
  json 'd["thumbnails"] == {"photos": 3, "folders": 3, "queued": 1, "not_queued": 2}'
  [ "$ERR" = "quvaidx scan: not queued: $share/new\\nline: the name holds a line feed, which a queue line cannot carry
quvaidx scan: not queued: $out: outside every share" ] || fail "stderr '$ERR'"
  expect_file "$WORK/q" "$share/a\n"
}

case_spool() {
  local q=$WORK/q.queue long trim_pid add_pid
  long=/$(printf '%*s' 4094 '' | tr ' ' x)
  t 0 "" spool add "$q" /share/a
  t 0 "" spool add "$q" /share/a /share/b /share/b # each entry queued once
  # One refused entry anywhere and nothing is added.
  t 2 "quvaidx spool: an entry must not hold a line feed (entry 2); nothing was added" \
    spool add "$q" /share/c $'/share/x\n/share/y'
  t 2 "quvaidx spool: an empty entry cannot be queued (entry 2)" spool add "$q" /share/c ''
  t 2 "quvaidx spool: an entry is 4096 bytes long; a queue line holds at most 4095" \
    spool add "$q" "${long}y"
  expect_file "$q" '/share/a\n/share/b\n'
  t 0 "" spool add "$q" "$long" # the longest entry fits
  t 0 "" spool add -- "$q" -dash
  t 0 "" spool add "$q" - < <(printf '/in/1\n\n/in/2\n')
  expect_file "$q" "/share/a\n/share/b\n$long\n-dash\n/in/1\n/in/2\n"
  t 2 "quvaidx spool: $WORK is not a regular file" spool add "$WORK" /share/a
  # trim drops the first N entries in place (they become empty lines) and
  # keeps the mode; a last line without a line feed stays as it is.
  printf '/a\n/b\n/c\n/d\n/e' >"$q"
  chmod 640 "$q"
  t 0 "" spool trim "$q" 0
  expect_file "$q" '/a\n/b\n/c\n/d\n/e'
  t 0 "" spool trim "$q" 2
  expect_entries "$q" '/c\n/d\n/e'
  [ "$(stat -c %a "$q")" = 640 ] || fail "mode $(stat -c %a "$q")"
  t 0 "" spool trim "$q" 9
  expect_file "$q" ''
  [ "$(ls -A "$WORK" | tr '\n' ' ')" = "err expected out q.queue " ] ||
    fail "files left beside the queue: $(ls -A "$WORK")"
  t 2 "quvaidx spool: $WORK/none: No such file or directory" spool trim "$WORK/none" 1
  # trim and add wait for the queue's lock; the entry added meanwhile is
  # kept, whichever goes first.
  printf '/a\n/b\n/c\n' >"$q"
  exec 9<"$q"
  flock -x 9
  timeout 5 "$TOOL" spool trim "$q" 1 >"$WORK/trim.out" 2>&1 9<&- &
  trim_pid=$!
  timeout 5 "$TOOL" spool add "$q" /d >"$WORK/add.out" 2>&1 9<&- &
  add_pid=$!
  PIDS+=("$trim_pid" "$add_pid")
  sleep 0.3
  kill -0 "$trim_pid" && kill -0 "$add_pid" || fail "no wait for the lock"
  expect_file "$q" '/a\n/b\n/c\n'
  exec 9<&- # unlocks
  wait "$trim_pid" && wait "$add_pid" ||
    fail "trim or add failed: $(cat "$WORK/trim.out" "$WORK/add.out")"
  expect_entries "$q" '/b\n/c\n/d\n'
}

# figures PID: descriptors, virtual and resident memory (kB) from /proc.
figures() {
  echo "$(ls "/proc/$1/fd" | wc -l)" \
    "$(awk '$1 == "VmSize:" || $1 == "VmRSS:" { printf "%s ", $2 }' "/proc/$1/status")"
}

case_stats() {
  local total pid before after
  total=$(awk '$1 == "MemTotal:" { print $2 }' /proc/meminfo)
  t 0 '*' stats
  has out "total memory     $total kB"
  sleep 30 >/dev/null 2>&1 9<&- &
  pid=$!
  PIDS+=("$pid")
  until_ok grep -qx sleep "/proc/$pid/comm" || fail "sleep did not start"
  # Its figures may still change as it starts: the tool's lie between those
  # read before and after it.
  before=$(figures "$pid")
  t 0 '*' stats --json "$pid"
  after=$(figures "$pid")
  json 'd["pid"] == int(A[0]) and d["mem_total_kb"] == int(A[1]) and all(
    min(b, a) <= d[k] <= max(b, a) for k, b, a in zip(
    ["descriptors", "vmsize_kb", "rss_kb"], *(map(int, s.split()) for s in A[2:])))' \
    "$pid" "$total" "$before" "$after"
  kill -KILL "$pid"
  wait "$pid" 2>/dev/null || true
  t 2 "quvaidx stats: no process $pid" stats "$pid"
}

# One meaning per short option across the tool, and every command takes
# -V for the version.
case_options() {
  local command letters version
  version=$("$TOOL" --version)
  for command in $("$TOOL" --help | awk '/^Commands:/ { on = 1; next }
      on && !NF { exit } on && $1 != "help" { print $1 }'); do
    t 0 "$version" "$command" -V
    "$TOOL" "$command" --help | grep -oE '^  -[^-], --[a-z0-9-]+' >>"$WORK/letters"
  done
  letters=$(sort -u "$WORK/letters" | awk '{ print $1 }' | uniq -d)
  [ -z "$letters" ] || fail "short options with two meanings: $letters"
}

# The media fixtures of tests/mediaparserd ($MEDIA_FIXTURES), under the names
# the tests use, and files that are no media.
make_media_samples() {
  local fx=${MEDIA_FIXTURES:-}
  [ -f "$fx/stamp" ] || fail "MEDIA_FIXTURES does not name the media fixtures"
  for copy in song_id3v24.mp3:song.mp3 song_id3v1_cp1251.mp3:legacy.mp3 \
    video_rot90.mp4:clip.mp4 photo_exif.jpg:photo.jpg photo.png:tiny.png \
    song.wav:song.wav song_id3v24.mp3:renamed.mp4; do
    cp "$fx/${copy%%:*}" "${copy#*:}"
  done
  printf 'hello' >fake.png
  mkfifo fifo.mp3
}

# The tool's mediainfo and resolution commands against the media parser
# daemon, $MEDIAPARSERD, with the host's code page at windows-1251.
case_mediainfo() {
  local sock=$WORK/mp.sock
  [ -x "${MEDIAPARSERD:-}" ] || fail "MEDIAPARSERD does not name the daemon"
  cd "$WORK"
  make_media_samples
  mkdir -p "$QUVA_HOST_ETC"
  printf '[system]\ncode_page = windows-1251\n' >"$QUVA_HOST_ETC/host.conf"
  start mp "quvamediaparserd: listening on $sock" "$MEDIAPARSERD" \
    --foreground --socket "$sock" --socket-mode 0666 --pidfile "$WORK/mp.pid"
  # The readable view: labelled lines of what each file holds.
  t 0 '*' mediainfo --socket "$sock" song.mp3 clip.mp4 photo.jpg legacy.mp3
  has out "song.mp3" "  Title        Überschrift ✓" "  Track        3" \
    "  Duration     0:01" "  Audio        MP3 32 kb/s 22.05 kHz mono" \
    "  Covers       1" "  Video        H.264 High 320x240 25 fps" \
    "  Rotation     90° clockwise" "  Camera       Canon EOS 5D Mark IV" \
    "  Exposure     1/125 s, f/2.8, ISO 400" "  Picture      640x480" \
    "  Title        Привет" "  Artist       Кино"
  # The daemon reads the content; the name only names the media table.
  t 0 '*' mediainfo --socket "$sock" renamed.mp4
  has out "  Type         music (the name says video)"
  # Relative names, here from standard input, are sent as absolute paths.
  t 0 '*' mediainfo --socket "$sock" --json - <<<$'song.mp3\nphoto.jpg\nclip.mp4'
  json '[[r["file"], r["table"], r["media_type"], m["szPath"], m["szName"],
    m["fileSize"], m["szContainerType"], len(m)] for r in d
    for m in [r["media"]]] == [[n, t, t, os.path.abspath(n), n,
    os.path.getsize(n), c, 47] for n, t, c in map(str.split, A[1:])]
    and d[0]["media"]["szMDate"] == A[0]' "$(date -r song.mp3 '+%F %T')" \
    "song.mp3 music mp3" "photo.jpg photo image2" \
    "clip.mp4 video mov,mp4,m4a,3gp,3g2,mj2"
  # The raw view of the record's fields.
  t 0 '*' mediainfo --socket "$sock" --raw photo.jpg
  has out "szPath:          $WORK/photo.jpg" "resolutionX:     640" "szExposure:      1/125"
  ! grep -q "^szTitle:" "$WORK/out" || fail "an empty field was listed"
  t 0 '*' mediainfo --socket "$sock" --raw song.wav # integers stay whole
  has out "audio_bitrate:   1411200"
  t 0 '*' mediainfo --socket "$sock" --all song.mp3 # empty fields as well
  has out "szDesc:          " "audio_bitrate:   32000"
  [ "$(grep -c : "$WORK/out")" -eq 48 ] || fail "not 48 lines"
  t 0 "640x480" resolution --socket "$sock" photo.jpg
  t 0 '*' resolution --socket "$sock" --json clip.mp4
  json 'd["width"] == 320 and d["height"] == 240'
  # Missing files, special files and no media are refused with a reason,
  # and the daemon goes on answering.
  t 1 "quvaidx resolution: fake.png: not a media file" resolution --socket "$sock" fake.png
  run mediainfo --socket "$sock" fifo.mp3 fake.png tiny.png
  expect 1
  has err "quvaidx mediainfo: fifo.mp3: not a regular file" \
    "quvaidx mediainfo: fake.png: not a media file"
  has out "  Picture      200x100"
  # Another user learns only about what it could read itself.
  if [ "$(id -u)" -eq 0 ]; then
    chmod 600 song.wav
    as_nobody
    t 1 "quvaidx mediainfo: $WORK/song.wav: Permission denied" \
      mediainfo --socket "$sock" "$WORK/song.wav"
    t 0 '*' mediainfo --socket "$sock" "$WORK/song.mp3"
    as_self
  fi
}

"case_$CASE"
echo "PASS [$CASE]"
