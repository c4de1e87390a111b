#!/usr/bin/env bash
# The README's quick start as a new user meets it: bootstraps a minimal
# Debian 12 root from Debian's archive (mmdebstrap --variant=minbase),
# clones this checkout's commit into it under /root, and runs there the
# main job (scripts/demo.sh) and the test command's install step and
# configure of both its builds. A package that a script needs but does
# not install fails here. The root is discarded afterwards.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh fresh-root

commit=$(git rev-parse HEAD)
checkout=/root/migrate_settings
# The hooks run with the root's /proc, /dev and /sys mounted and the
# host's resolver configuration, and mmdebstrap removes them afterwards.
# Output to /dev/null: the root lives in a temporary directory only.
mmdebstrap --variant=minbase --quiet \
  --customize-hook="git clone --quiet --no-checkout '$PWD' \"\$1$checkout\"" \
  --customize-hook="git -C \"\$1$checkout\" checkout --quiet --detach $commit" \
  --customize-hook="chroot \"\$1\" sh -ec 'cd $checkout; scripts/demo.sh; \
scripts/install-deps.sh tests; cmake --preset default >/dev/null; cmake --preset asan >/dev/null; \
echo \"fresh root: demo and test configure passed\"'" \
  bookworm /dev/null http://deb.debian.org/debian
