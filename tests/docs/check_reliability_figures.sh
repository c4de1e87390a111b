#!/usr/bin/env bash
# Renders the figures of a copy of DOCUMENT from RESULTS_DIR and fails, with
# the differences, when DOCUMENT is not what the renderer makes of it.
# usage: check_reliability_figures.sh PYTHON RENDERER RESULTS_DIR DOCUMENT
set -euo pipefail
python=$1 render=$2 results=$3 document=$4
scratch=$(mktemp -d /tmp/reliability-figures.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
cp "$document" "$scratch/rendered.md"
"$python" "$render" "$results" "$scratch/rendered.md"
if ! diff -u --label document --label rendered "$document" "$scratch/rendered.md"; then
  echo "the figures differ from $results: run scripts/render_reliability.py"
  exit 1
fi
