#!/usr/bin/env bash
# Builds the project and runs every test, in the optimised build and in the
# AddressSanitizer + UndefinedBehaviorSanitizer build.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh tests

for preset in default asan; do
  echo "=== preset: $preset"
  cmake --preset "$preset" >/dev/null
  cmake --build --preset "$preset"
  ctest --preset "$preset"
  # The power-cut exploration's, the soak's and the overlap stress's totals, from the log of the run above.
  grep -h -e "crash exploration totals" -e "broken writer:" -e "soak: [0-9]* runs" -e "^overlap.*: [0-9]* rounds" \
    "build/$preset/Testing/Temporary/LastTest.log" || true
done
