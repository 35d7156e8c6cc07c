#!/usr/bin/env bash
# The bash completion of quvaidx offers what the tool's --help says:
# commands, each command's options, daemon names after --daemon, files
# after an option that takes a value. completion_test.sh TOOL COMPLETION
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
check() {
  local expected=$1
  shift
  local got
  got=$(complete_words "$@")
  [ "$got" = "$expected" ] || {
    echo "FAIL: quvaidx $* -> '$got', expected '$expected'" >&2
    exit 1
  }
}

check "send serve" se
check "--verbose --help --version" --
check "--nowait" -v taskq --now
check "--timeout" send --ti
check "controld" send -d co
check "mediad" send --daemon me
check "$work/request.json" send --socket "$work/req"
check "thumb" help th
# Every command the tool lists is offered, and each has --help.
for command in $(complete_words ""); do
  [ "$command" = help ] && continue
  [[ " $(complete_words "$command" --) " == *" --help "* ]] ||
    { echo "FAIL: no --help offered for $command" >&2; exit 1; }
done
echo "completion check passed"
