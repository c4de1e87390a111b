#!/usr/bin/env bash
# check_reliability_figures.sh itself: a document whose figure was edited by
# hand, or whose results file lost a summary line, is rejected.
# usage: check_reliability_figures_test.sh CHECK PYTHON RENDERER RESULTS_DIR DOCUMENT
set -euo pipefail
check=$1 python=$2 render=$3 results=$4 document=$5
scratch=$(mktemp -d /tmp/reliability-figures-test.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
failures=0

expect() {  # NAME EXPECTED_STATUS EXPECTED_LAST_LINE DOCUMENT RESULTS_DIR
  local name=$1 want_status=$2 want_last=$3 status=0 output
  output=$("$check" "$python" "$render" "$5" "$4" 2>&1) || status=$?
  if [ "$status" -ne "$want_status" ] || [ "$(tail -n 1 <<<"$output")" != "$want_last" ]; then
    printf 'FAIL %s: status %s, output:\n%s\nwanted status %s, last line:\n%s\n' \
      "$name" "$status" "$output" "$want_status" "$want_last"
    failures=$((failures + 1))
  fi
}

expect unchanged 0 "" "$document" "$results"

# A figure of the soak's table changed by hand.
sed '/^<!-- soak figures -->$/,/^<!-- end soak figures -->$/s/^| \([0-9,]*\) | /| 9\1 | /' "$document" \
  >"$scratch/edited.md"
cmp -s "$document" "$scratch/edited.md" && { echo "FAIL edited: the edit changed nothing"; failures=$((failures + 1)); }
expect edited 1 "the figures differ from $results: run scripts/render_reliability.py" "$scratch/edited.md" "$results"

# The soak's totals line missing from its results file.
cp -r "$results" "$scratch/results"
grep -v ' runs, ' "$results/soak.txt" >"$scratch/results/soak.txt" || true
expect no_totals 1 "render_reliability: $scratch/results/soak.txt has no totals line" "$document" "$scratch/results"

exit $((failures > 0))
