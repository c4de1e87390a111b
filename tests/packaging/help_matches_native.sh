#!/usr/bin/env bash
# The cross-built tool under its emulator prints the same --help, byte for
# byte, as the native build. Both run as "./migrate_settings", since the
# usage line shows argv[0].
# usage: help_matches_native.sh NATIVE_TOOL EMULATOR... TOOL
# Exit status 77 (skip) when NATIVE_TOOL has not been built, unless
# REQUIRE_NATIVE_TOOL=1.
set -euo pipefail
native=$1
shift
command=("$@")
tool=${command[-1]}
unset 'command[-1]'

if [ ! -x "$native" ]; then
  echo "native tool $native not built: build the default preset first"
  [ "${REQUIRE_NATIVE_TOOL:-0}" = 1 ] && exit 1
  exit 77
fi
scratch=$(mktemp -d /tmp/help-matches-native.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
mkdir "$scratch/native" "$scratch/cross"
ln -s "$(realpath "$native")" "$scratch/native/migrate_settings"
ln -s "$(realpath "$tool")" "$scratch/cross/migrate_settings"

native_status=0 cross_status=0
(cd "$scratch/native" && ./migrate_settings --help) >"$scratch/native.out" 2>&1 || native_status=$?
(cd "$scratch/cross" && "${command[@]}" ./migrate_settings --help) >"$scratch/cross.out" 2>&1 || cross_status=$?
if [ "$native_status" -ne 0 ] || [ "$cross_status" -ne 0 ]; then
  echo "--help exit status: native $native_status, emulated $cross_status"
  exit 1
fi
if ! cmp "$scratch/native.out" "$scratch/cross.out"; then
  diff -u "$scratch/native.out" "$scratch/cross.out" || true
  exit 1
fi
