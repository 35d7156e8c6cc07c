#!/usr/bin/env bash
# The bash completion of quvaidx offers what the tool's --help says:
# commands, a command's operations, the options of the operation at hand
# (each once, and none already given), daemon names for a NAME, files for a
# PATH, nothing more after a flag of a command without operands.
#   completion_test.sh TOOL COMPLETION
set -euo pipefail
tool=$1
# shellcheck source=/dev/null
source "$2"
work=$(mktemp -d /tmp/quvaidx-completion.XXXXXX)
trap 'rm -rf "$work"' EXIT
touch "$work/request.json"

# complete WORD...: COMPREPLY for the last word of the command line.
complete_words() {
  COMP_WORDS=("$tool" "$@")
  COMP_CWORD=$((${#COMP_WORDS[@]} - 1))
  _quvaidx
  echo "${COMPREPLY[*]}"
}
common="--verbose --help --version"
while IFS='|' read -r expected words; do
  read -ra words <<<"$words"
  [ "${words[-1]}" = '""' ] && words[-1]=""
  got=$(complete_words "${words[@]}")
  [ "$got" = "$expected" ] || {
    echo "FAIL: quvaidx ${words[*]} -> '$got', expected '$expected'" >&2
    exit 1
  }
done <<CASES
send serve|se
--verbose --help --version|--
thumb|help th
create push pop count delete|taskq ""
add trim|spool ""
--type --nowait --attempts $common|taskq pop /k 7 --
--nowait --attempts $common|taskq pop /k 7 --type 2 --
--size $common|taskq create /k 7 --
--null $common|spool add /q --
--nowait|-v taskq --now
--timeout|send --ti
controld|send -d co
mediad|send --daemon me
$work/request.json|send --socket $work/req
--socket --pidfile $common|serve --daemon ""
--daemon --attempts --timeout --handshake --compact $common|send -s x --
controld scand workerd plugind mediad|daemons ""
CASES
# Every command the tool lists is offered, with --help once.
for command in $(complete_words ""); do
  [ "$command" = help ] && continue
  offered=" $(complete_words "$command" --) "
  [ "$(grep -o ' --help ' <<<"$offered" | wc -l)" -eq 1 ] ||
    { echo "FAIL: --help not offered once for $command: $offered" >&2; exit 1; }
  [ "$(tr ' ' '\n' <<<"$offered" | sort | uniq -d)" = "" ] ||
    { echo "FAIL: an option offered twice for $command" >&2; exit 1; }
done
echo "completion check passed"
