#!/usr/bin/env bash
# Builds migrate_settings and runs its main job: a checked migration of a
# settings block into a store in a scratch directory, then a query of it.
# Without the tests, it needs only the compiler and the build tools.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
cmake --preset tool >/dev/null
cmake --build --preset tool --target migrate_settings make_example_data

tool=build/tool/lib/storage/tools/migrate_settings
scratch=$(mktemp -d /tmp/migrate-settings-demo.XXXXXX)

build/tool/lib/storage/tools/make_example_data settings "$scratch/settings.bin" 4094
echo "== data file: $scratch/settings.bin ($(stat -c %s "$scratch/settings.bin") bytes, 4094 declared)"

echo "== migrate_settings --base $scratch/store --target settings --type checked --check settings --data $scratch/settings.bin --verbose"
status=0
"$tool" --base "$scratch/store" --target settings --type checked --check settings \
  --data "$scratch/settings.bin" --verbose || status=$?
echo "exit status: $status"

echo "== migrate_settings --base $scratch/store --target settings --query-present"
status=0
"$tool" --base "$scratch/store" --target settings --query-present || status=$?
echo "exit status: $status (0: present, 10: absent)"

echo "== what the settings store holds"
find "$scratch/store/settings" -type f -printf '%P  %s bytes\n' | sort
echo "check file of the written copy (size, then CRC-32, little-endian):"
od -A d -t x1 "$scratch/store/settings/2/data.chk"
