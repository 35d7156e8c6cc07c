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
# ok [STDOUT]: success with nothing on stderr.
ok() {
  expect 0 "$@"
  [ -z "$ERR" ] || fail "stderr '$ERR'"
}
# expect_error TEXT [RC]: nothing on stdout, one stderr line starting with
# TEXT, exit status RC (2).
expect_error() {
  expect "${2:-2}" ""
  [[ $ERR != *$'\n'* && $ERR == "$1"* ]] ||
    fail "stderr '$ERR', expected one line starting with '$1'"
}
# has out|err TEXT: the last run printed TEXT there.
has() { grep -qF -- "$2" "$WORK/$1" || fail "$1 lacks '$2'"; }
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
  run send --socket "$sock" --handshake --compact '{"command":"HANDSHAKE"}'
  ok '{"success":true}'
  run send -s "$sock" -c '{"command":"ECHO","n":[1,2],"s":"x"}'
  ok '{"echo":{"command":"ECHO","n":[1,2],"s":"x"},"success":true}'
  run send -s "$sock" '{"command":"ECHO"}' # indented without --compact
  ok
  [ "$(wc -l <"$WORK/out")" -gt 3 ] || fail "reply not indented"
  # A request the daemon refuses: exit status 1, its reply on stdout.
  run send -s "$sock" -c '{"command":"NOPE"}'
  expect 1 '{"reason":"unknown command","success":false}'
  # Requests refused before sending.
  for request in '{"command":' '{} x' '' '{"a":1,}' '{"a":1,"a":2}' \
    '{"a":1} // c' "$(printf '%*s' 5000 '' | tr ' ' '[')"; do
    run send -s "$sock" "$request"; expect_error "quvaidx send: invalid JSON request: "
  done
  run send -s "$sock" '[1]'
  expect_error "quvaidx send: the request must be a JSON object"
  run send -s "$sock" "{\"command\":\"ECHO\",\"big\":\"$(printf '%*s' 20000 '' | tr ' ' x)\"}"
  expect_error "quvaidx send: the request is 20028 bytes long; a packet carries at most 16380"
  # The request from standard input ("-" or none); the reply in raw UTF-8
  # with numbers in their shortest exact form.
  run send -s "$sock" -c <<<'{"command":"ECHO","s":"h\u00e9llo","x":0.1}'
  ok '{"echo":{"command":"ECHO","s":"héllo","x":0.1},"success":true}'
  # Earlier clients have closed, and the refused requests never arrived.
  run send -s "$sock" -c '{"command":"STATS"}'
  ok '{"connections":1,"requests":7,"success":true}'
  # A second daemon is refused on a live socket and on a regular file.
  run serve -s "$sock"
  expect_error "quvaidx serve: a daemon is already listening on $sock"
  echo keep >"$WORK/file"
  run serve -s "$WORK/file"
  expect_error "quvaidx serve: $WORK/file exists and is not a socket"
  [ "$(cat "$WORK/file")" = keep ] || fail "the file was changed"
  run send -s "$sock" -c '{"command":"HANDSHAKE"}'; ok '{"success":true}'
  stop TERM "$sock"
  # --verbose: the library's debug lines reach stderr.
  grep -qF "[quvaidx-serve] BEV_EVENT_EOF" "$WORK/serve.err" ||
    fail "no library log line on the daemon's stderr"
}

case_lifecycle() {
  # A socket path of 107 bytes works end to end; 108 is refused.
  local sock
  sock=$WORK/$(printf '%*s' $((106 - ${#WORK})) '' | tr ' ' p)
  run send -s "${sock}q" '{}'
  expect_error "quvaidx send: socket path is 108 bytes long; a Unix-domain socket path holds at most 107"
  run serve -s "${sock}q"; expect_error "quvaidx serve: socket path is 108 bytes long"
  [ ! -e "${sock}q" ] || fail "a socket file was created"
  # A daemon killed outright leaves its socket, where no one answers.
  serve "$sock"
  kill -KILL "$BG"
  wait "$BG" 2>/dev/null || true
  [ -S "$sock" ] || fail "the killed daemon's socket is gone"
  run send -s "$sock" --attempts 1 '{"command":"HANDSHAKE"}'
  expect_error "quvaidx send: no daemon answered on $sock after 1 attempt: connection refused"
  # Each failure names its reason, and no attempt is followed by a wait.
  run send -s "$WORK/none" --attempts 1 '{}'
  expect_error "quvaidx send: no daemon answered on $WORK/none after 1 attempt: no such socket"
  : >"$WORK/plain"
  run send -s "$WORK/plain" --attempts 2 '{}'
  expect_error "quvaidx send: no daemon answered on $WORK/plain after 2 attempts: not a socket"
  # A daemon that accepts and never answers: --timeout bounds the wait.
  start mute mute python3 -c 'import socket, sys, time
s = socket.socket(socket.AF_UNIX); s.bind(sys.argv[1]); s.listen(1)
print("mute", flush=True); c = s.accept(); time.sleep(10)' "$WORK/mute.sock"
  run send -s "$WORK/mute.sock" --timeout 0.2 '{}'
  expect_error "quvaidx send: the daemon on $WORK/mute.sock sent no reply within 0.2 s"
  # A new daemon replaces the stale socket; SIGINT stops it cleanly.
  serve "$sock"
  run send -s "$sock" -c '{"command":"HANDSHAKE"}'; ok '{"success":true}'
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
  run daemons; ok
  # Nothing runs the index daemons on a test machine; a live one's row
  # would show its pid.
  if [ -z "$(ls /var/run/quvaindex*.pid /var/run/quvamediaparserd.pid 2>/dev/null)" ]; then
    [ "$OUT" = "$DAEMONS" ] || fail "not the daemon table"
  fi
  run daemons --json; ok
  json '[[e["name"], e["pid_file"], e["executable"], e["socket"]] for e in d]
    == [[r[0]] + r[3:] for r in map(str.split, A[0].splitlines()[1:])]
    and all(e["alive"] is False and e["pid"] is None for e in d
    if not os.path.exists(e["pid_file"]))' "$DAEMONS"
  run daemons mediad scand; ok
  [ "$(awk 'NR > 1 { print $1 }' "$WORK/out" | tr '\n' ' ')" = "mediad scand " ] ||
    fail "not the rows asked for, in their order"
  run daemons nosuchd; expect_error "quvaidx daemons: $UNKNOWN"
  run send --daemon nosuchd '{"command":"HANDSHAKE"}'
  expect_error "quvaidx send: $UNKNOWN"
  # A known name resolves to the directory's socket (one attempt: 1 s).
  if [ ! -e /tmp/quvaindexd_sock ]; then
    run send --daemon controld --attempts 1 '{"command":"HANDSHAKE"}'
    expect_error "quvaidx send: no daemon answered on /tmp/quvaindexd_sock after 1 attempt"
  fi
}

# new_queue KEYFILE PROJECT: creates the key file and a queue deleted on exit.
new_queue() {
  : >"$1"
  run taskq create "$1" "$2"; ok
  [[ $OUT =~ ^[0-9]+$ ]] || fail "create printed '$OUT', not an identifier"
  QUEUES+=("$1 $2 $OUT")
}

case_taskq() {
  local key=$WORK/q.key big pid started
  run taskq create "$WORK/none.key" 7
  expect_error "quvaidx taskq: key file $WORK/none.key: No such file or directory"
  new_queue "$key" 7
  run taskq push "$key" 7 '{"n":1}'; ok ""
  run taskq push "$key" 7 --type 2 '{"s":"two","n":2}'; ok ""
  run taskq count "$key" 7; ok 2
  run taskq pop "$key" 7 --type 2; ok '{"n":2,"s":"two"}' # though pushed last
  run taskq pop "$key" 7; ok '{"n":1}'
  run taskq push "$key" 7 '{"a":1'; expect_error "quvaidx taskq: invalid JSON task: "
  # The largest task a queue carries: 8191 bytes with its line end.
  big=$(printf '%*s' 8182 '' | tr ' ' x)
  run taskq push "$key" 7 "{\"a\":\"${big}y\"}"
  expect_error "quvaidx taskq: the task is 8192 bytes long; a queue carries at most 8191"
  run taskq push "$key" 7 "{\"a\":\"$big\"}"; ok
  run taskq pop "$key" 7 --nowait; ok "{\"a\":\"$big\"}"
  # A blocking pop waits for the next push.
  timeout 5 "$TOOL" taskq pop "$key" 7 >"$WORK/wait.out" 2>&1 &
  pid=$!
  PIDS+=("$pid")
  sleep 0.2
  kill -0 "$pid" 2>/dev/null || fail "the blocking pop did not wait"
  run taskq push "$key" 7 --type 5 '{"late":true}'; ok
  wait "$pid" && [ "$(cat "$WORK/wait.out")" = '{"late":true}' ] ||
    fail "the blocking pop: $(cat "$WORK/wait.out")"
  # Empty: the tool does not wait after its last attempt.
  started=$(date +%s%N)
  run taskq pop "$key" 7 --nowait --attempts 1
  expect_error "quvaidx taskq: no task of type 0 after 1 attempt" 1
  (( ($(date +%s%N) - started) / 1000000 < 800 )) ||
    fail "an empty --nowait pop waited after its last attempt"
  # create discards what the queue held; delete removes it.
  run taskq push "$key" 7 '{"old":1}'; ok
  new_queue "$key" 7
  run taskq count "$key" 7; ok 0
  run taskq delete "$key" 7; ok ""
  run taskq pop "$key" 7 --nowait
  expect_error "quvaidx taskq: no queue for key file $key, project 7"
  run taskq delete "$key" 7; ok ""
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
  run serve --daemon --pidfile "$WORK/none/d.pid" --socket "$sock"
  expect_error "quvaidx serve: cannot create the pid file $WORK/none/d.pid: $WORK/none: No such file or directory"
  run serve --daemon --pidfile "$pid_file" --socket "$WORK/none/d.sock"
  expect_error "quvaidx serve: cannot create the socket $WORK/none/d.sock: $WORK/none: No such file or directory"
  # Relative paths hold, though the detached daemon works in "/".
  cd "$WORK"
  run serve --daemon --pidfile d.pid --socket d.sock; ok ""
  until_ok test -s d.pid -a -S d.sock || fail "no pid file or socket"
  pid=$(cat d.pid)
  PIDS+=("$pid")
  run send -s d.sock -c '{"command":"HANDSHAKE"}'; ok '{"success":true}'
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
  run scan --json "$WORK/tree"; ok
  expect_counts "$TREE_COUNTS"
  json 'd["roots"] == A and "files" not in d and d["elapsed_seconds"] >= 0' "$root"
  # With --list, the list goes to stdout and the summary to stderr.
  run scan --list "$WORK/tree"; expect 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(tree_list "$root")" ] || fail "list"
  has err "Scanned 7 folders and 17 files in "
  has err "  photo            7   6 need thumbnails, in 4 folders; 5 converted for the web"
  has err "Skipped 9 entries:"
  has err "  symbolic links (never followed)                 2"
  run scan --json --list "$WORK/tree"; ok
  expect_counts "$TREE_COUNTS"
  json 'sorted(f["table"] + "\t" + f["path"] for f in d["files"]) == A' "${list[@]}"
  # Every DIR is checked before anything is scanned.
  run scan --json "$WORK/tree" "$WORK/none" "$WORK/tree/notes.txt"; expect 2 ""
  [ "$ERR" = "quvaidx scan: cannot scan $WORK/none: No such file or directory
quvaidx scan: cannot scan $WORK/tree/notes.txt: not a folder" ] || fail "stderr"
  # Tabs, line feeds and backslashes in names are escaped in the list.
  mkdir "$WORK/odd"
  odd=$(cd -P "$WORK/odd" && pwd)
  touch "$odd/"$'tab\tname.mp3' "$odd/"$'new\nline.jpg' "$odd/back\\slash.png"
  run scan --list "$WORK/odd"; expect 0
  [ "$(LC_ALL=C sort "$WORK/out")" = "$(printf '%s\n' "music	$odd/tab\\tname.mp3" \
    "photo	$odd/back\\\\slash.png" "photo	$odd/new\\nline.jpg")" ] || fail "escapes"
  if [ ! -e /var/run/quvamkthumbd.pid ]; then # no thumbnail daemon here
    run scan --queue-thumbs --json "$WORK/tree"; expect 1
    [[ $ERR == "quvaidx scan: cannot queue /"*" for thumbnails: the thumbnail daemon is not running"* &&
      $ERR != *$'\n'* ]] || fail "stderr '$ERR'"
    json 'd["thumbnails"] == {"photos": 6, "folders": 4, "queued": 0, "not_queued": 4}'
  fi
  # An unreadable folder: reported, and the rest is scanned. Root reads any
  # folder, so it scans as nobody, who needs a way into $WORK.
  mkdir -p "$WORK/tree/locked/inner"
  touch "$WORK/tree/locked/inner/x.mp3" "$WORK/tree/locked/y.jpg"
  chmod 000 "$WORK/tree/locked"
  [ "$(id -u)" -ne 0 ] || as_nobody
  run scan --json "$WORK/tree"
  as_self
  chmod 755 "$WORK/tree/locked"
  expect 1
  [ "$ERR" = "quvaidx scan: cannot read $root/locked: Permission denied" ] ||
    fail "stderr '$ERR'"
  expect_counts "${TREE_COUNTS/unreadable_folders=0/unreadable_folders=1}"
}

case_spool() {
  local q=$WORK/q.queue long trim_pid add_pid
  long=/$(printf '%*s' 4094 '' | tr ' ' x)
  run spool add "$q" /share/a; ok ""
  run spool add "$q" /share/a /share/b /share/b # each entry queued once
  ok ""
  # One refused entry anywhere and nothing is added.
  run spool add "$q" /share/c $'/share/x\n/share/y'
  expect_error "quvaidx spool: an entry must not hold a line feed (entry 2); nothing was added"
  run spool add "$q" /share/c ''
  expect_error "quvaidx spool: an empty entry cannot be queued (entry 2)"
  run spool add "$q" "${long}y"
  expect_error "quvaidx spool: an entry is 4096 bytes long; a queue line holds at most 4095"
  expect_file "$q" '/share/a\n/share/b\n'
  run spool add "$q" "$long" # the longest entry fits
  ok
  run spool add -- "$q" -dash; ok
  expect_file "$q" "/share/a\n/share/b\n$long\n-dash\n"
  run spool add "$WORK" /share/a
  expect_error "quvaidx spool: $WORK is not a regular file"
  # trim drops the first N entries in place (they become empty lines) and
  # keeps the mode; a last line without a line feed stays as it is.
  printf '/a\n/b\n/c\n/d\n/e' >"$q"
  chmod 640 "$q"
  run spool trim "$q" 0; ok ""
  expect_file "$q" '/a\n/b\n/c\n/d\n/e'
  run spool trim "$q" 2; ok ""
  expect_entries "$q" '/c\n/d\n/e'
  [ "$(stat -c %a "$q")" = 640 ] || fail "mode $(stat -c %a "$q")"
  run spool trim "$q" 9; ok ""
  expect_file "$q" ''
  [ "$(ls -A "$WORK" | tr '\n' ' ')" = "err expected out q.queue " ] ||
    fail "files left beside the queue: $(ls -A "$WORK")"
  run spool trim "$WORK/none" 1
  expect_error "quvaidx spool: $WORK/none: No such file or directory"
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

case_thumb() {
  local kind daemon before
  run thumb "$WORK/none"
  expect_error "quvaidx thumb: $WORK/none: No such file or directory"
  mkfifo "$WORK/fifo"
  run thumb --video "$WORK/fifo"
  expect_error "quvaidx thumb: $WORK/fifo is neither a directory nor a regular file"
  # No preview daemon runs on a test machine: nothing is queued.
  before=$(ls -l /var/spool/{thumb,flv}_create.queue 2>&1 || true)
  for kind in "thumbnail quvamkthumbd" "web-video quvamkflvd"; do
    read -r kind daemon <<<"$kind"
    [ ! -e "/var/run/$daemon.pid" ] || continue
    if [ "$kind" = thumbnail ]; then run thumb "$WORK"; else run thumb -V "$WORK"; fi
    expect_error "quvaidx thumb: the $kind daemon ($daemon) is not running: /var/run/$daemon.pid names no live process; nothing was queued"
  done
  [ "$(ls -l /var/spool/{thumb,flv}_create.queue 2>&1 || true)" = "$before" ] ||
    fail "a queue was touched"
}

# figures PID: descriptors, virtual and resident memory (kB) from /proc.
figures() {
  echo "$(ls "/proc/$1/fd" | wc -l)" \
    "$(awk '$1 == "VmSize:" || $1 == "VmRSS:" { printf "%s ", $2 }' "/proc/$1/status")"
}

case_stats() {
  local total lines pid before after
  total=$(awk '$1 == "MemTotal:" { print $2 }' /proc/meminfo)
  run stats; ok
  mapfile -t lines <"$WORK/out"
  [[ ${#lines[@]} -eq 5 && ${lines[0]} =~ ^pid\ +[0-9]+$ &&
    ${lines[1]} =~ ^descriptors\ +[0-9]+$ &&
    ${lines[2]} =~ ^resident\ memory\ +[0-9]+\ kB$ &&
    ${lines[3]} =~ ^virtual\ memory\ +[0-9]+\ kB$ &&
    ${lines[4]} == "total memory     $total kB" ]] || fail "own figures"
  sleep 30 >/dev/null 2>&1 9<&- &
  pid=$!
  PIDS+=("$pid")
  until_ok grep -qx sleep "/proc/$pid/comm" || fail "sleep did not start"
  # Its figures may still change as it starts: the tool's lie between those
  # read before and after it.
  before=$(figures "$pid")
  run stats --json "$pid"
  after=$(figures "$pid")
  ok
  json 'd["pid"] == int(A[0]) and d["mem_total_kb"] == int(A[1]) and all(
    min(b, a) <= d[k] <= max(b, a) for k, b, a in zip(
    ["descriptors", "vmsize_kb", "rss_kb"], *(map(int, s.split()) for s in A[2:])))' \
    "$pid" "$total" "$before" "$after"
  kill -KILL "$pid"
  wait "$pid" 2>/dev/null || true
  run stats "$pid"; expect_error "quvaidx stats: no process $pid"
}

# The media fixtures of tests/mediaparserd ($MEDIA_FIXTURES), under the names
# the tests use, and files that are no media.
make_media_samples() {
  local fx=${MEDIA_FIXTURES:-}
  [ -f "$fx/stamp" ] || fail "MEDIA_FIXTURES does not name the media fixtures"
  cp "$fx/song_id3v24.mp3" song.mp3
  cp "$fx/song_id3v1_cp1251.mp3" legacy.mp3
  cp "$fx/video_rot90.mp4" clip.mp4
  cp "$fx/photo_exif.jpg" photo.jpg
  cp "$fx/photo.png" tiny.png
  cp "$fx/song.wav" song.wav
  cp song.mp3 renamed.mp4
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
  run mediainfo --socket "$WORK/none.sock" --attempts 1 tiny.png
  expect_error "quvaidx mediainfo: no reply from the media parser on $WORK/none.sock after 1 attempt"
  start mp "quvamediaparserd: listening on $sock" "$MEDIAPARSERD" \
    --foreground --socket "$sock" --socket-mode 0666 --pidfile "$WORK/mp.pid"
  # The readable view: labelled lines of what each file holds.
  run mediainfo --socket "$sock" song.mp3 clip.mp4 photo.jpg legacy.mp3; ok
  for line in "song.mp3" "  Title        Überschrift ✓" "  Track        3" \
      "  Duration     0:01" "  Audio        MP3 32 kb/s 22.05 kHz mono" \
      "  Covers       1" "  Video        H.264 High 320x240 25 fps" \
      "  Rotation     90° clockwise" "  Camera       Canon EOS 5D Mark IV" \
      "  Exposure     1/125 s, f/2.8, ISO 400" "  Picture      640x480" \
      "  Title        Привет" "  Artist       Кино"; do
    has out "$line"
  done
  # The daemon reads the content; the name only names the media table.
  run mediainfo --socket "$sock" renamed.mp4; ok
  has out "  Type         music (the name says video)"
  # Relative names are sent as absolute paths.
  run mediainfo --socket "$sock" --json song.mp3 photo.jpg clip.mp4; ok
  json '[[r["file"], r["table"], r["media_type"], m["szPath"], m["szName"],
    m["fileSize"], m["szContainerType"], len(m)] for r in d
    for m in [r["media"]]] == [[n, t, t, os.path.abspath(n), n,
    os.path.getsize(n), c, 47] for n, t, c in map(str.split, A[1:])]
    and d[0]["media"]["szMDate"] == A[0]' "$(date -r song.mp3 '+%F %T')" \
    "song.mp3 music mp3" "photo.jpg photo image2" \
    "clip.mp4 video mov,mp4,m4a,3gp,3g2,mj2"
  # The raw view of the record's fields.
  run mediainfo --socket "$sock" --raw photo.jpg; ok
  has out "szPath:          $WORK/photo.jpg"
  has out "resolutionX:     640"
  has out "szExposure:      1/125"
  ! grep -q "^szTitle:" "$WORK/out" || fail "an empty field was listed"
  run mediainfo --socket "$sock" --raw song.wav; ok # integers stay whole
  has out "audio_bitrate:   1411200"
  run mediainfo --socket "$sock" --all song.mp3 # empty fields as well
  ok
  has out "szDesc:          "
  has out "audio_bitrate:   32000"
  [ "$(grep -c : "$WORK/out")" -eq 48 ] || fail "not 48 lines"
  run resolution --socket "$sock" photo.jpg; ok "640x480"
  run resolution --socket "$sock" --json clip.mp4; ok
  json 'd["width"] == 320 and d["height"] == 240'
  # Missing files, special files and no media are refused with a reason,
  # and the daemon goes on answering.
  run resolution --socket "$sock" fake.png
  expect_error "quvaidx resolution: fake.png: not a media file" 1
  run mediainfo --socket "$sock" fifo.mp3 fake.png tiny.png
  expect 1
  has err "quvaidx mediainfo: fifo.mp3: not a regular file"
  has err "quvaidx mediainfo: fake.png: not a media file"
  has out "  Picture      200x100"
  # Another user learns only about what it could read itself.
  if [ "$(id -u)" -eq 0 ]; then
    chmod 600 song.wav
    as_nobody
    run mediainfo --socket "$sock" "$WORK/song.wav"
    expect_error "quvaidx mediainfo: $WORK/song.wav: Permission denied" 1
    run mediainfo --socket "$sock" "$WORK/song.mp3"; ok
    as_self
  fi
}

"case_$CASE"
echo "PASS [$CASE]"
