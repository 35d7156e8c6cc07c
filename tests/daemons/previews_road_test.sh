#!/usr/bin/env bash
# The whole road of previews with real processes at the installation's fixed
# paths: `quvaidx scan --queue-thumbs SHARE` queues the photo folders in
# /var/spool/thumb_create.queue and wakes the daemon of
# /var/run/quvamkthumbd.pid; quvamkthumbd makes the thumbnails; `quvaidx
# sizemap`, `thumb` and `plugins` ask quvaindexplugind on
# /tmp/quvaindexplugind_sock.
#
#   previews_road_test.sh QUVAIDX QUVAMKTHUMBD QUVAINDEXPLUGIND
#
# It runs in a private mount namespace (scripts/private_paths.sh) in which
# /var/spool, /run and /tmp are the test's own, so the fixed paths are used
# for real while the machine's own stay untouched; where none can be made
# it is skipped (77). A stand-in pid file naming this script's shell makes
# the index daemon, which is not part of the road, count as alive.
set -euo pipefail
# shellcheck source=../../scripts/private_paths.sh
source "$(dirname "$0")/../../scripts/private_paths.sh"

if [ "${1:-}" != --inside ]; then
  # Outside: make the work directory, enter a namespace, clean up after.
  if ! command -v vips >/dev/null 2>&1; then
    echo "SKIP: the vips command (libvips-tools) makes the photos; not found"
    exit 77
  fi
  if ! find_private_namespace; then
    echo "SKIP: cannot make a private mount namespace (needs root, or" \
         "user namespaces): the fixed paths cannot be used safely here"
    exit 77
  fi
  # The machine's own files at the fixed paths, to prove they stay as they
  # were.
  fixed=(/var/spool/thumb_create.queue /var/run/quvamkthumbd.pid
         /var/run/quvaindexplugind.pid /var/run/quvaindexd.pid
         /tmp/quvaindexplugind_sock)
  before=$(stat -L -c '%n %i %Y' "${fixed[@]}" 2>/dev/null || true)
  work=$(mktemp -d /tmp/quvaidx-road.XXXXXX)
  status=0
  timeout 120 "${NAMESPACE[@]}" bash "$0" --inside "$work" "$1" "$2" "$3" ||
    status=$?
  after=$(stat -L -c '%n %i %Y' "${fixed[@]}" 2>/dev/null || true)
  # The namespace's mounts are gone: only plain files remain.
  rm -rf "$work"
  if [ "$before" != "$after" ]; then
    echo "FAIL: the machine's own files at the fixed paths changed" >&2
    exit 1
  fi
  exit $status
fi

# Inside the namespace.
work=$2
TOOL=$3
MKTHUMBD=$4
PLUGIND=$5
PIDS=()
fail() { echo "FAIL: $*" >&2; tail -n 20 "$work"/*.err >&2; exit 1; }
cleanup() {
  local pid
  for pid in "${PIDS[@]}"; do kill -KILL "$pid" 2>/dev/null || true; done
  for pid in "${PIDS[@]}"; do wait "$pid" 2>/dev/null || true; done
}
trap cleanup EXIT

mount_private_paths road "$work" "$TOOL" "$MKTHUMBD" "$PLUGIND" "$0"
[ -d "$work" ] || fail "the work directory is not reachable after the mounts"
export QUVA_HOST_ETC=$work/host-etc # no boot step file: booted

# The share, the only one of the host's database: photos in two folders
# (one below the other), a PNG, files of other kinds.
share=$work/share
mkdir -p "$share/Photos/2023" "$share/Music" "$QUVA_HOST_ETC"
printf '[share]\npath = %s\n' "$share" >"$QUVA_HOST_ETC/shares.conf"
vips black "$share/Photos/a.jpg" 1600 1200 --bands 3
vips black "$share/Photos/b.jpg" 300 200 --bands 3
vips black "$share/Photos/2023/c.png" 640 480 --bands 3
: >"$share/Photos/notes.txt"
: >"$share/Music/song.mp3"

"$MKTHUMBD" --foreground --stderr >"$work/mkthumbd.out" 2>"$work/mkthumbd.err" &
PIDS+=($!)
"$PLUGIND" --foreground --stderr >"$work/plugind.out" 2>"$work/plugind.err" &
PIDS+=($!)
wait_for 10 grep -qs running "$work/mkthumbd.out" ||
  fail "quvamkthumbd did not start"
wait_for 10 grep -qs listening "$work/plugind.out" ||
  fail "quvaindexplugind did not start"

# The road: scan queues the two photo folders, the daemon is woken.
timeout 20 "$TOOL" scan --queue-thumbs "$share" >"$work/scan.out" \
  2>"$work/scan.err" || fail "scan --queue-thumbs failed"
grep -q "Queued for thumbnails: 2 folders" "$work/scan.out" "$work/scan.err" ||
  fail "scan did not queue the two photo folders"
thumbs_done() {
  [ ! -s /var/spool/thumb_create.queue ] &&
    [ -s "$share/Photos/.quvameta/a.jpg/QUVAPHOTO_THUMB_S.jpg" ] &&
    [ -s "$share/Photos/2023/.quvameta/c.png/QUVAPHOTO_THUMB_XL.jpg" ]
}
wait_for 30 thumbs_done || fail "the thumbnails were not made"

# The size maps, against the files actually present.
sizemap() { timeout 10 "$TOOL" sizemap "$@"; }
out=$(sizemap "$share/Photos/a.jpg" "$share/Photos/b.jpg" \
  "$share/Photos/notes.txt" "$share/Photos/2023")
expected="0xf	XL,B,M,S	$share/Photos/a.jpg
0xf	XL,B,M,S	$share/Photos/b.jpg
0x0	-	$share/Photos/notes.txt
0xf	XL,B,M,S	$share/Photos/2023 (photo $share/Photos/2023/c.png)"
[ "$out" = "$expected" ] || fail "size maps: got
$out
expected
$expected"

# `quvaidx thumb` finds the daemon alive and a removed size comes back.
rm "$share/Photos/.quvameta/a.jpg/QUVAPHOTO_THUMB_B.jpg"
[ "$(sizemap "$share/Photos/a.jpg" | cut -f1,2)" = "0xb	XL,M,S" ] ||
  fail "size map after a removal"
timeout 10 "$TOOL" thumb "$share/Photos/a.jpg" || fail "thumb failed"
wait_for 20 test -s "$share/Photos/.quvameta/a.jpg/QUVAPHOTO_THUMB_B.jpg" ||
  fail "the removed thumbnail was not made again"
wait_for 10 test ! -s /var/spool/thumb_create.queue || fail "queue not served"
[ "$(sizemap "$share/Photos/a.jpg" | cut -f1)" = 0xf ] ||
  fail "size map after thumb"

# Plug-in names: only with the index daemon alive (its stand-in pid file).
timeout 10 "$TOOL" plugins >/dev/null 2>&1 &&
  fail "plugins asked although the index daemon is not running"
echo $$ >/var/run/quvaindexd.pid
out=$(timeout 10 "$TOOL" plugins) || fail "plugins failed"
[ "$out" = photo_thumbnail ] || fail "plugin names: '$out'"
timeout 10 "$TOOL" daemons plugind | grep -q '^plugind.*yes' ||
  fail "quvaidx daemons plugind does not show it alive, or exits non-zero"

# Both daemons end on SIGTERM and take their files with them.
kill -TERM "${PIDS[@]}"
for pid in "${PIDS[@]}"; do
  wait "$pid" || fail "a daemon ended with status $?"
done
PIDS=()
for f in /var/run/quvamkthumbd.pid /var/run/quvaindexplugind.pid \
  /tmp/quvaindexplugind_sock; do
  [ ! -e "$f" ] || fail "$f was left behind"
done
[ -z "$(find "$share" -name '*.part-*')" ] || fail "temporary files left"
echo "previews road: passed"
