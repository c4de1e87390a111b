#!/usr/bin/env bash
# Builds everything for the device (ARM64) with Debian's cross compiler and
# runs the tests under qemu-aarch64, then builds the fully static tool and
# reports its stripped size, and checks that inspect_store ships beside it.
# The ARM64 tool's --help is compared with the native build's (made here
# when missing).
#   cross-test.sh [--static-only]
# --static-only builds and checks the static tool alone: CI runs the ARM64
# suite on the emulated device instead (arm64-device.sh test).
set -euo pipefail
cd "$(dirname "$0")/.."
static_only=0
case ${1:-} in
  --static-only) static_only=1 ;;
  "") ;;
  *) echo "usage: scripts/cross-test.sh [--static-only]" >&2; exit 2 ;;
esac
scripts/install-deps.sh cross

native=build/default/lib/storage/tools/migrate_settings
if [ ! -x "$native" ]; then
  cmake --preset default >/dev/null
  cmake --build --preset default --target migrate_settings
fi

# "ELF 64-bit LSB ..., ARM aarch64, ..." for every preset's tool.
check_arm64() {
  local description
  description=$(file -L "$1")
  echo "$description"
  case $description in
    *", ARM aarch64, "*) ;;
    *) echo "not an ARM64 program: $1" >&2; return 1 ;;
  esac
}

if [ "$static_only" = 0 ]; then
  echo "=== preset: aarch64"
  cmake --preset aarch64 >/dev/null
  cmake --build --preset aarch64
  check_arm64 build/aarch64/lib/storage/tools/migrate_settings
  REQUIRE_NATIVE_TOOL=1 ctest --preset aarch64
fi

echo "=== preset: aarch64-static"
cmake --preset aarch64-static >/dev/null
cmake --build --preset aarch64-static
prefix=$(mktemp -d /tmp/migrate-settings-static.XXXXXX)
trap 'rm -rf "$prefix"' EXIT
cmake --install build/aarch64-static --prefix "$prefix" --strip >/dev/null
tool=$prefix/bin/migrate_settings
check_arm64 "$tool"
file -L "$tool" | grep -q ', statically linked, ' || { echo "not statically linked: $tool" >&2; exit 1; }
# No sysroot: a static program needs none of the target's libraries.
REQUIRE_NATIVE_TOOL=1 tests/packaging/help_matches_native.sh "$native" qemu-aarch64 "$tool"
echo "static ARM64 migrate_settings, stripped: $(stat -c %s "$tool") bytes"

inspector=$prefix/bin/inspect_store
check_arm64 "$inspector"
file -L "$inspector" | grep -q ', statically linked, ' || { echo "not statically linked: $inspector" >&2; exit 1; }
# It runs: an empty base holds only empty slots.
qemu-aarch64 "$inspector" --base "$prefix/no-stores" --target lut --index 25 | grep -q '^lut  *25  *empty ' ||
  { echo "the static ARM64 inspect_store does not report an empty slot" >&2; exit 1; }
echo "static ARM64 inspect_store, stripped: $(stat -c %s "$inspector") bytes"
