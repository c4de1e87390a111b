#!/bin/sh
# Runs a built storage_consumer on a store directory that does not exist
# yet and compares what it prints with what it must print.
# usage: run_consumer.sh STORE [EMULATOR...] PROGRAM
set -eu
store=$1
shift
output=$("$@" "$store")
expected=$(printf '%s\n' "DualFileTarget $store with 2 slots" 'slot 0: empty' \
  'slot 1: "settings for another program" crc32 b8eb8420')
if [ "$output" != "$expected" ]; then
  printf 'storage_consumer printed:\n%s\ninstead of:\n%s\n' "$output" "$expected" >&2
  exit 1
fi
