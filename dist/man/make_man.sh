#!/usr/bin/env bash
# Makes the man pages from the programs' own --help, with help2man:
#
#   make_man.sh OUTDIR VERSION QUVAIDX [DAEMON...]
#
# OUTDIR/man1/quvaidx.1 for the tool, OUTDIR/man1/quvaidx-COMMAND.1 for each
# of its commands (as `quvaidx --help` lists them), OUTDIR/man8/DAEMON.8 for
# each daemon. A page's NAME line is the command's summary, or the first
# line of the daemon's description.
set -euo pipefail

[ $# -ge 3 ] || { echo "usage: $0 OUTDIR VERSION QUVAIDX [DAEMON...]" >&2; exit 2; }
out=$1 version=$2 tool=$3
shift 3
mkdir -p "$out/man1" "$out/man8" "$out/wrappers"

# The first line of the description: the line after the blank line that
# ends the usage lines, without its final full stop.
summary_of() {
  "$@" --help | awk 'started && NF { sub(/\.$/, "");
                       print tolower(substr($0, 1, 1)) substr($0, 2); exit }
                     /^$/ { started = 1 }'
}

h2m() { help2man --no-info --no-discard-stderr --version-string="$version" "$@"; }

# The commands, from the "Commands:" block of the tool's help.
mapfile -t commands < <("$tool" --help |
  awk '/^Commands:/ { on = 1; next } on && !NF { exit } on { print }')
see_also=$(mktemp)
trap 'rm -f "$see_also"' EXIT
pages=()
for line in "${commands[@]}"; do
  read -r name _ <<<"$line"
  [ "$name" = help ] || pages+=("quvaidx\\-$name (1)")
done
for daemon in "$@"; do pages+=("$(basename "$daemon") (8)"); done
{
  echo "[SEE ALSO]"
  for ((i = 0; i < ${#pages[@]}; i++)); do
    printf '.BR %s%s\n' "${pages[i]}" "$( ((i + 1 < ${#pages[@]})) && echo ,)"
  done
} >"$see_also"

h2m --section=1 --name="command-line access to the media-index daemons" \
  --include="$see_also" --output="$out/man1/quvaidx.1" "$tool"

for line in "${commands[@]}"; do
  read -r name summary <<<"$line"
  [ "$name" = help ] && continue
  # help2man names the page after the program it runs.
  wrapper=$out/wrappers/quvaidx-$name
  printf '#!/bin/sh\nexec "%s" %s "$@"\n' "$tool" "$name" >"$wrapper"
  chmod +x "$wrapper"
  h2m --section=1 --name="$summary" --output="$out/man1/quvaidx-$name.1" \
    "$wrapper"
done

for daemon in "$@"; do
  name=$(basename "$daemon")
  h2m --section=8 --name="$(summary_of "$daemon")" \
    --output="$out/man8/$name.8" "$daemon"
done
rm -rf "$out/wrappers"
