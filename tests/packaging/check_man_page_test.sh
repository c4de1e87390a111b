#!/usr/bin/env bash
# check_man_page.sh itself: manual pages that differ from --help by one
# option, or by the pairing of a short and a long name, are rejected with
# exactly the differing entries.
# usage: check_man_page_test.sh CHECK_SCRIPT MAN_PAGE COMMAND...
set -euo pipefail
check=$1 man_page=$2
shift 2
command=("$@")
scratch=$(mktemp -d /tmp/check-man-page-test.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
failures=0

expect() {  # NAME EXPECTED_STATUS EXPECTED_OUTPUT SED_SCRIPT
  local name=$1 want_status=$2 want_output=$3 edit=$4 status=0 output
  sed "$edit" "$man_page" >"$scratch/$name.1"
  if cmp -s "$man_page" "$scratch/$name.1" && [ -n "$edit" ]; then
    echo "FAIL $name: the edit changed nothing in the manual page"
    failures=$((failures + 1))
    return
  fi
  output=$("$check" "$scratch/$name.1" "${command[@]}") || status=$?
  if [ "$status" -ne "$want_status" ] || [ "$output" != "$want_output" ]; then
    printf 'FAIL %s: status %s, output:\n%s\nwanted status %s, output:\n%s\n' \
      "$name" "$status" "$output" "$want_status" "$want_output"
    failures=$((failures + 1))
  fi
}

expect unchanged 0 "" ''
expect debug_missing 1 "only in --help: --debug" '/^\.TP$/{N;/\n\.B \\-\\-debug$/d}'
expect extra_option 1 "only in the manual page: -x --extra" \
  's/^\.B \\-\\-debug$/.BR \\-x ", " \\-\\-extra\n.TP\n.B \\-\\-debug/'
expect short_name_changed 1 "only in --help: -i --index
only in the manual page: -j --index" 's/\\-i ", " \\-\\-index/\\-j ", " \\-\\-index/'
expect short_name_dropped 1 "only in --help: -v --verbose
only in the manual page: --verbose" 's/^\.BR \\-v ", " \\-\\-verbose$/.B \\-\\-verbose/'
expect no_options_section 1 "no options in the manual page's OPTIONS section" '/^\.SH OPTIONS$/d'

exit $((failures > 0))
