#!/usr/bin/env bash
# Runs a GoogleTest program as N shards at once, each with its share of the
# cases, and prints their outputs one after the other. Exit status: 0 when
# every shard passed, else the first failed shard's.
#   run_in_shards.sh N PROGRAM [ARGS...]
set -uo pipefail
shards=$1
shift
outputs=$(mktemp -d)
trap 'rm -rf "$outputs"' EXIT
pids=()
for ((index = 0; index < shards; index++)); do
  GTEST_TOTAL_SHARDS=$shards GTEST_SHARD_INDEX=$index "$@" >"$outputs/$index" 2>&1 &
  pids+=($!)
done
status=0
for ((index = 0; index < shards; index++)); do
  wait "${pids[index]}"
  code=$?
  [ "$status" -ne 0 ] || status=$code
  echo "=== shard $index of $shards: exit status $code"
  cat "$outputs/$index"
done
exit "$status"
