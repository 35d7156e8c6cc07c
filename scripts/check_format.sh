#!/usr/bin/env bash
# Fails, listing what differs, when a tracked C or C++ file is not formatted
# as .clang-format says (clang-format's dry run, warnings as errors).
set -euo pipefail
cd "$(dirname "$0")/.."
mapfile -t files < <(git ls-files '*.c' '*.cc' '*.h')
clang-format --dry-run --Werror "${files[@]}"
echo "formatting: ${#files[@]} files as clang-format writes them"
