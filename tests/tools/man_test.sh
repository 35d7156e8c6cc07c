#!/usr/bin/env bash
# The man pages made from --help keep its layout: each command of quvaidx(1)
# in a paragraph of its own, each example of quvaidx-COMMAND(1) on a line of
# its own.   man_test.sh TOOL MAN_DIR
set -euo pipefail
tool=$1
pages=$2
fail() { echo "FAIL: $*" >&2; exit 1; }
# render PAGE: the page as man shows it, wide enough for every example.
render() { MANWIDTH=200 man -l "$pages/man1/$1.1" 2>/dev/null | sed 's/^ *//'; }

main=$(render quvaidx)
commands=$("$tool" --help | awk '/^Commands:/ { on = 1; next } on && !NF { exit }
                                 on { print $1 }')
for command in $commands; do
  grep -qE "^$command( |$)" <<<"$main" || fail "quvaidx.1 runs '$command' into another paragraph"
  [ "$command" = help ] && continue
  page=$(render "quvaidx-$command")
  while read -r example; do
    grep -qxF -- "$example" <<<"$page" ||
      fail "quvaidx-$command.1 does not show '$example' on a line of its own"
  done < <("$tool" "$command" --help |
    awk '/^Examples?:$/ { on = 1; next } on && !NF { exit } on { sub(/^ +/, ""); print }')
done
echo "man page check passed"
