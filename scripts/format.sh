#!/usr/bin/env bash
# Formats every C and C++ source of the tree with .clang-format (Debian's
# clang-format), or with --check only reports the files that differ and
# exits 1 when there is one.
#   format.sh [--check]
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh format
mapfile -t sources < <(git ls-files '*.c' '*.h' '*.cpp')
if [ "${1:-}" = --check ]; then
  clang-format --dry-run -Werror "${sources[@]}"
else
  clang-format -i "${sources[@]}"
fi
