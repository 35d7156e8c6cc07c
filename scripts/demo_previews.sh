#!/usr/bin/env bash
# The previews part of the tour: the thumbnail daemon and the plug-in daemon
# at work at the installation's fixed paths.
#
#   scripts/demo_previews.sh BUILD_DIR
#
# The daemons and the library use fixed paths (/var/spool/thumb_create.queue,
# /var/run/*.pid, /tmp/quvaindexplugind_sock). So that the demo touches none
# of this machine's own, it runs in a private mount namespace (unshare, as
# root or in a user namespace) in which /var/spool, /run and /tmp are fresh
# private directories; where no namespace can be made it says so and shows
# nothing. There it starts quvamkthumbd and quvaindexplugind, scans a sample
# share with `quvaidx scan --queue-thumbs`, waits for the thumbnails, asks
# the plug-in daemon for size maps (`quvaidx sizemap`) and plug-in names
# (`quvaidx plugins`, after writing a stand-in pid file for the index
# daemon, which is not part of the demo), and stops both daemons.
set -euo pipefail
# shellcheck source=private_paths.sh
source "$(dirname "$0")/private_paths.sh"

if [ "${1:-}" != --inside ]; then
  if [ $# -ne 1 ]; then
    echo "usage: $0 BUILD_DIR" >&2
    exit 2
  fi
  build=$(cd "$1" && pwd)
  for f in tools/quvaidx daemons/mkthumbd/quvamkthumbd \
    daemons/plugind/quvaindexplugind; do
    if [ ! -x "$build/$f" ]; then
      echo "(the preview daemons are not built: $build/$f is missing)"
      exit 0
    fi
  done
  if ! command -v vips >/dev/null 2>&1; then
    echo "(no vips command to make sample photos: install libvips-tools)"
    exit 0
  fi
  if ! find_private_namespace; then
    echo "(skipped: the preview daemons use fixed paths under /var and /tmp;"
    echo " the demo needs a private mount namespace for them, which needs"
    echo " root or user namespaces)"
    exit 0
  fi
  work=$(mktemp -d /tmp/quvaidx-demo-previews.XXXXXX)
  status=0
  timeout 120 "${NAMESPACE[@]}" bash "$0" --inside "$work" "$build" ||
    status=$?
  rm -rf "$work" # the namespace's mounts are gone with it
  exit $status
fi

work=$2
build=$3
tool=$build/tools/quvaidx
PIDS=()
cleanup() {
  local pid
  for pid in "${PIDS[@]}"; do kill -TERM "$pid" 2>/dev/null || true; done
  for pid in "${PIDS[@]}"; do wait "$pid" 2>/dev/null || true; done
}
trap cleanup EXIT

heading() { printf '\n== %s\n' "$*"; }
show() {
  local status=0
  printf '$ quvaidx %s\n' "$*"
  timeout 20 "$tool" "$@" || status=$?
  echo "(exit status $status)"
}

mount_private_paths demo "$work" "$build" "$0"
export QUVA_HOST_ETC=$work/host-etc

heading "A private mount namespace: /var/spool, /run and /tmp are fresh here,
so the daemons use their fixed paths without touching this machine's"
echo "\$ ls -A /var/spool /var/run /tmp"
ls -A /var/spool /var/run /tmp | sed 's/^/  /'

heading "Start the thumbnail daemon and the plug-in daemon with their
default paths"
echo "\$ quvamkthumbd --foreground --stderr --loglevel 6 &"
"$build/daemons/mkthumbd/quvamkthumbd" --foreground --stderr --loglevel 6 \
  >"$work/mkthumbd.out" 2>"$work/mkthumbd.err" &
PIDS+=($!)
echo "\$ quvaindexplugind --foreground &"
"$build/daemons/plugind/quvaindexplugind" --foreground \
  >"$work/plugind.out" 2>"$work/plugind.err" &
PIDS+=($!)
wait_for 10 grep -qs running "$work/mkthumbd.out"
wait_for 10 grep -qs listening "$work/plugind.out"
cat "$work/mkthumbd.out" "$work/plugind.out"
show daemons

heading "A sample share, declared in the host's share database: photos in two
folders, a video, a song"
share=$work/share
mkdir -p "$share/Photos/2023" "$share/Video" "$share/Music" "$QUVA_HOST_ETC"
printf '[Multimedia]\npath = %s\n' "$share" >"$QUVA_HOST_ETC/shares.conf"
sed 's/^/  /' "$QUVA_HOST_ETC/shares.conf"
vips black "$share/Photos/IMG_0001.jpg" 4000 3000 --bands 3
vips black "$share/Photos/IMG_0002.jpg" 1200 1600 --bands 3
vips black "$share/Photos/2023/scan.png" 800 600 --bands 3
: >"$share/Video/holiday.mp4"
: >"$share/Music/song.mp3"
(cd "$work" && find share -type f | LC_ALL=C sort | sed 's/^/  /')

heading "Scan it and queue the photo folders: WriteThumbQueue appends them to
/var/spool/thumb_create.queue and wakes the daemon with SIGUSR1"
show scan --queue-thumbs "$share"
wait_for 30 test ! -s /var/spool/thumb_create.queue
sleep 0.2
echo "The daemon's log:"
sed -n 's/^quvamkthumbd\[[0-9]*\]: /  /p' "$work/mkthumbd.err"

heading "The thumbnails, in each photo's metadata (EA) directory"
(cd "$work" && find share -path '*.quvameta*' -type f | LC_ALL=C sort |
  while read -r f; do
    printf '  %-58s %s\n' "$f" "$(vipsheader "$f" | sed 's/.*: //; s/ uchar.*//')"
  done)

heading "Size maps from the plug-in daemon: XL 0x8, B 0x4, M 0x2, S 0x1;
a folder answers for its first photo by name"
show sizemap "$share/Photos/IMG_0001.jpg" "$share/Photos/2023/scan.png" \
  "$share/Photos" "$share/Music/song.mp3"

heading "Remove one thumbnail: the map follows the files present"
echo "\$ rm $share/Photos/.quvameta/IMG_0001.jpg/QUVAPHOTO_THUMB_B.jpg"
rm "$share/Photos/.quvameta/IMG_0001.jpg/QUVAPHOTO_THUMB_B.jpg"
show sizemap "$share/Photos/IMG_0001.jpg"

heading "Queue the photo again (quvaidx thumb): only the missing size is made.
A song queues nothing, and a folder outside every share is refused"
show thumb "$share/Photos/IMG_0001.jpg" "$share/Music/song.mp3" "$work" 2>&1
wait_for 20 test -s "$share/Photos/.quvameta/IMG_0001.jpg/QUVAPHOTO_THUMB_B.jpg"
show sizemap "$share/Photos/IMG_0001.jpg"

heading "Plug-in names: asked only while the index daemon runs; it is not
part of this demo, so first there is no answer, then a stand-in pid file
(naming this shell) makes IsQuvaindexAlive true"
show plugins 2>&1
echo "\$ echo \$\$ > /var/run/quvaindexd.pid   # stand-in for the index daemon"
echo $$ >/var/run/quvaindexd.pid
show plugins

heading "Stop both daemons with SIGTERM: they remove their pid files and
socket"
echo "\$ kill -TERM ${PIDS[*]}"
kill -TERM "${PIDS[@]}"
for pid in "${PIDS[@]}"; do wait "$pid" || true; done
PIDS=()
sed -n 's/^quvamkthumbd\[[0-9]*\]: .*stopping/  quvamkthumbd: stopping/p' \
  "$work/mkthumbd.err"
echo "\$ ls -A /var/run /tmp"
ls -A /var/run /tmp | sed 's/^/  /'
