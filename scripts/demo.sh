#!/usr/bin/env bash
# A guided tour of the quvaidx tool.
#
#   scripts/demo.sh BUILD_DIR
#
# Lists the index daemons (`quvaidx daemons`), starts the sample daemon
# (`quvaidx serve`) with a socket and a pid file in a fresh temporary
# directory, talks to it with `quvaidx send`, stops it with SIGTERM and
# checks that it removed its socket and pid file; then takes a task queue
# through create, push, count, pop and delete (`quvaidx taskq`), and scans
# a sample share with the index's rules (`quvaidx scan`), and asks the
# media-parser daemon about a real song, photo and video and a legacy tag
# (`quvaidx mediainfo`, `quvaidx resolution`), and shows the road of
# previews (scripts/demo_previews.sh). Everything
# it starts or creates is removed on exit, however the script ends, so it
# can be run again at once.
set -euo pipefail

if [ $# -ne 1 ]; then
  echo "usage: $0 BUILD_DIR   (for example: $0 build)" >&2
  exit 2
fi
build=$1
repo=$(cd "$(dirname "$0")/.." && pwd)
# A relative BUILD_DIR is taken from the current directory, else from the
# repository root.
if [ -x "$build/tools/quvaidx" ]; then
  tool=$(cd "$build" && pwd)/tools/quvaidx
elif [ -x "$repo/$build/tools/quvaidx" ]; then
  tool=$repo/$build/tools/quvaidx
else
  echo "demo: no quvaidx tool under $build/tools; build first:" >&2
  echo "  cmake -S $repo -B $build && cmake --build $build" >&2
  exit 2
fi

work=""
server_pid=""
queue_key=""
cleanup() {
  if [ -n "${mp_pid:-}" ]; then
    kill -TERM "$mp_pid" 2>/dev/null || true
    wait "$mp_pid" 2>/dev/null || true
  fi
  if [ -n "$server_pid" ] && kill -0 "$server_pid" 2>/dev/null; then
    kill -TERM "$server_pid" 2>/dev/null || true
    wait "$server_pid" 2>/dev/null || true
  fi
  if [ -n "$queue_key" ]; then
    timeout 10 "$tool" taskq delete "$queue_key" 7 >/dev/null 2>&1 || true
  fi
  if [ -n "$work" ]; then rm -rf "$work"; fi
}
# The traps come first, so that nothing made below can outlive the script.
trap cleanup EXIT
trap 'exit 130' INT
trap 'exit 143' TERM

work=$(mktemp -d /tmp/quvaidx-demo.XXXXXX)
sock=$work/demo.sock
pid_file=$work/demo.pid

heading() { printf '\n== %s\n' "$*"; }

# show ARGS...: prints the command as it would be typed at a shell prompt,
# runs it, and prints its exit status.
show() {
  local status=0 arg
  printf '$ quvaidx'
  for arg in "$@"; do
    if [[ $arg =~ ^[A-Za-z0-9_./=:-]+$ ]]; then
      printf ' %s' "$arg"
    else
      printf " '%s'" "${arg//\'/\'\\\'\'}"
    fi
  done
  printf '\n'
  timeout 10 "$tool" "$@" || status=$?
  echo "(exit status $status)"
}

heading "The index daemons: pid file, executable, socket, and whether alive"
show daemons

heading "Asked by name, as systemctl is-active: exit status 3 when not alive"
show daemons mediad

heading "Start the sample daemon in the background, with a pid file"
echo "\$ quvaidx serve --socket $sock --pidfile $pid_file &"
"$tool" serve --socket "$sock" --pidfile "$pid_file" \
  >"$work/serve.out" 2>"$work/serve.err" &
server_pid=$!
for ((i = 0; i < 250; i++)); do
  grep -qs "listening on" "$work/serve.out" && break
  kill -0 "$server_pid" 2>/dev/null || break
  sleep 0.02
done
if ! grep -qs "listening on" "$work/serve.out"; then
  echo "demo: the daemon did not start:" >&2
  cat "$work/serve.err" >&2
  exit 1
fi
cat "$work/serve.out"
echo "\$ cat $pid_file"
cat "$pid_file"
echo

heading "A second instance with the same pid file refuses to start"
show serve --socket "$work/other.sock" --pidfile "$pid_file"

heading "Handshake: the daemon proves its request layer answers"
show send --socket "$sock" --handshake '{"command":"HANDSHAKE"}'

heading "ECHO: the reply carries the request back under \"echo\""
show send --socket "$sock" '{"command":"ECHO","path":"/share/video/a.mp4","size":1048576}'

heading "The same, on one line with --compact"
show send --socket "$sock" --compact '{"command":"ECHO","tags":["x","y"]}'

heading "STATS: open connections (this one) and requests received so far
(the --handshake exchange above counted as two)"
show send --socket "$sock" '{"command":"STATS"}'

heading "An unknown command: \"success\" is false, so the exit status is 1"
show send --socket "$sock" '{"command":"REINDEX"}'

heading "A malformed request never leaves the tool: exit status 2"
show send --socket "$sock" '{"command":"ECHO",}' 2>&1

heading "Stop the daemon with SIGTERM"
echo "\$ kill -TERM $server_pid"
kill -TERM "$server_pid"
status=0
wait "$server_pid" || status=$?
server_pid=""
sed -n '2,$p' "$work/serve.out"
echo "(daemon exit status $status)"
for path in "$sock" "$pid_file"; do
  if [ -e "$path" ]; then
    echo "demo: $path is still there" >&2
    exit 1
  fi
done
echo "The socket and the pid file are gone."

heading "No daemon any more: one attempt, then exit status 2 and the reason"
show send --socket "$sock" --attempts 1 '{"command":"HANDSHAKE"}' 2>&1

heading "A daemon that accepts and never answers: --timeout bounds the wait"
python3 -c 'import socket, sys, time
s = socket.socket(socket.AF_UNIX); s.bind(sys.argv[1]); s.listen(1)
print("up", flush=True); c = s.accept(); time.sleep(5)' "$work/mute.sock" \
  >"$work/mute.out" &
mute=$!
for _ in $(seq 100); do grep -qs up "$work/mute.out" && break; sleep 0.05; done
show send --socket "$work/mute.sock" --timeout 0.5 '{"command":"HANDSHAKE"}' 2>&1
kill "$mute" 2>/dev/null || true
wait "$mute" 2>/dev/null || true

heading "A task queue, named by a key file and a project number"
queue_key=$work/queue.key
: >"$queue_key"
show taskq create "$queue_key" 7
show taskq push "$queue_key" 7 '{"path":"/share/photo/a.jpg"}'
show taskq push "$queue_key" 7 --type 2 '{"path":"/share/video/b.mp4"}'
show taskq count "$queue_key" 7

heading "Type 2 first, then whatever is oldest"
show taskq pop "$queue_key" 7 --type 2
show taskq pop "$queue_key" 7

heading "Empty now: one attempt and no wait after it, exit status 1"
show taskq pop "$queue_key" 7 --nowait --attempts 1 2>&1

heading "Delete the queue"
show taskq delete "$queue_key" 7
queue_key=""
show taskq count "$work/queue.key" 7 2>&1

heading "A sample share to scan: media of every kind, upper-case extensions,
and names the index skips (AppleDouble files, the recycle bin, snapshots,
the metadata folder, an application bundle), symbolic links (one a loop)"
share=$work/share
mkdir -p "$share"/{Music,Video,Photos/2023,Photos.app,'#recycle','#snapshot'} \
  "$share"/{.quvameta/IMG_0001.JPG,Docs}
touch "$share"/Music/{SONG.MP3,track02.flac,favourites.m3u,._SONG.MP3} \
  "$share"/Video/{holiday.mp4,concert.mkv,CLIP.AVI} \
  "$share"/Photos/{IMG_0001.JPG,scan.png,logo.gif,layers.psd} \
  "$share"/Photos/2023/DSC_0042.NEF "$share"/Photos.app/icon.png \
  "$share"/'#recycle'/old.mp3 "$share"/.quvameta/IMG_0001.JPG/thumb.jpg \
  "$share"/Docs/notes.txt "$share"/._cover.jpg
ln -s .. "$share"/Docs/loop
ln -s Music/SONG.MP3 "$share"/latest.mp3
(cd "$work" && find share | LC_ALL=C sort | sed 's/^/  /')

heading "Scan it with the index's rules: what the index would hold, and what
it skips and why"
show scan "$share"

heading "One line per file with its media table (the summary goes to stderr)"
echo "\$ quvaidx scan --list $share 2>/dev/null | sort | head -8"
"$tool" scan --list "$share" 2>/dev/null | LC_ALL=C sort | head -8

heading "Machine-readable: the same summary as JSON (an excerpt)"
echo "\$ quvaidx scan --json $share | grep -A6 '\"tables\"'"
"$tool" scan --json "$share" | grep -A6 '"tables"'

heading "A missing folder is an error: exit status 2"
show scan "$work/no-such-share" 2>&1

heading "The media-parser daemon (daemons/mediaparserd), on a socket
and a pid file of its own, asked about a song, a photo and a video"
build_dir=${tool%/tools/quvaidx}
mediaparserd=$build_dir/daemons/mediaparserd/quvamediaparserd
if [ ! -x "$mediaparserd" ]; then
  echo "(not built: configure with -DQUVAIDX_BUILD_DAEMONS=ON)"
else
  # Real media made with ffmpeg and exiftool by the tests' fixture script
  # (a few seconds the first time, then kept in the build tree).
  fixtures=$build_dir/tests/mediaparserd/fixtures
  if [ ! -f "$fixtures/stamp" ]; then
    fixtures=$build_dir/media-fixtures
    echo "(making the sample media once: ffmpeg, exiftool)"
    bash "$repo/tests/mediaparserd/make_fixtures.sh" "$fixtures"
  fi
  media=$work/media
  mkdir -p "$media"
  cp "$fixtures/song_id3v24.mp3" "$media/Track 01.mp3"
  cp "$fixtures/photo_exif.jpg" "$media/holiday.jpg"
  cp "$fixtures/video_rot90.mp4" "$media/clip.mp4"
  cp "$fixtures/song_id3v1_cp1251.mp3" "$media/old-tag.mp3"
  printf 'not a picture' >"$media/fake.png"
  # The host's settings: this appliance's code page is windows-1251.
  mkdir -p "$work/host-etc"
  printf '[system]\ncode_page = windows-1251\n' >"$work/host-etc/host.conf"
  mp_sock=$work/mediaparserd.sock
  echo "\$ QUVA_HOST_ETC=$work/host-etc quvamediaparserd --foreground --socket $mp_sock --pidfile $work/mediaparserd.pid &"
  QUVA_HOST_ETC=$work/host-etc "$mediaparserd" --foreground --socket "$mp_sock" \
    --pidfile "$work/mediaparserd.pid" \
    >"$work/mediaparserd.out" 2>&1 &
  mp_pid=$!
  for ((i = 0; i < 250; i++)); do
    grep -qs "listening on" "$work/mediaparserd.out" && break
    sleep 0.02
  done
  cat "$work/mediaparserd.out"
  show mediainfo --socket "$mp_sock" "$media/Track 01.mp3" "$media/holiday.jpg" \
    "$media/clip.mp4"
  show resolution --socket "$mp_sock" "$media/holiday.jpg"
  echo "\$ quvaidx mediainfo --json --socket $mp_sock $media/clip.mp4 | grep -E 'media_type|szVideoCodec|resolution'"
  "$tool" mediainfo --json --socket "$mp_sock" "$media/clip.mp4" |
    grep -E 'media_type|szVideoCodec|resolution'

  heading "A legacy tag: an ID3v1 title in windows-1251 bytes, which a
Latin-1 reader shows as \"$(printf '\317\360\350\342\345\362' | iconv -f latin1 -t utf-8 2>/dev/null || echo '?')\"; the host's code page decides"
  show mediainfo --socket "$mp_sock" "$media/old-tag.mp3"

  heading "Content, not names: a text called fake.png and a missing file are
refused with a reason, exit status 1"
  show mediainfo --socket "$mp_sock" "$media/fake.png" "$media/missing.jpg" 2>&1

  heading "Stop it with SIGTERM: it removes its socket and pid file"
  echo "\$ kill -TERM $mp_pid"
  kill -TERM "$mp_pid"
  wait "$mp_pid" || true
  mp_pid=""
  if [ -e "$mp_sock" ] || [ -e "$work/mediaparserd.pid" ]; then
    echo "demo: mediaparserd left its socket or pid file" >&2
    exit 1
  fi
  echo "The socket and the pid file are gone."
fi

heading "Previews: the thumbnail daemon and the plug-in daemon at their fixed
paths, in a private mount namespace (scripts/demo_previews.sh)"
bash "$repo/scripts/demo_previews.sh" "${tool%/tools/quvaidx}"

echo
echo "Demo finished; removing $work."
