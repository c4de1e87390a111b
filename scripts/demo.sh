#!/usr/bin/env bash
# Builds migrate_settings and shows its usage.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
cmake --preset default >/dev/null
cmake --build --preset default --target migrate_settings

build/default/lib/storage/tools/migrate_settings --help
