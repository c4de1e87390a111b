#!/usr/bin/env bash
# Builds the benchmarks (preset bench: optimised, no tests) and runs them:
# the micro-benchmarks, then bench/compare.sh. Their raw output goes to
# bench/results/, and the tables of docs/PERFORMANCE.md are rewritten from
# it, so one run of this script refreshes every figure there.
#   scripts/bench.sh               build, measure, rewrite the tables
#   scripts/bench.sh --build-only  build only (CI keeps the benchmarks compiling)
# The scratch stores go to $TMPDIR (default /tmp): measure on the file
# system whose cost you want to know.
set -euo pipefail
cd "$(dirname "$0")/.."
case ${1:-} in
  "" | --build-only) ;;
  *) echo "usage: scripts/bench.sh [--build-only]" >&2; exit 2 ;;
esac
scripts/install-deps.sh bench

cmake --preset bench >/dev/null
cmake --build --preset bench
[ "${1:-}" = --build-only ] && exit 0

results=bench/results
mkdir -p "$results"
{
  echo "date: $(date -u +%Y-%m-%dT%H:%MZ)"
  echo "cpu: $(sed -n 's/^model name[[:space:]]*: //p' /proc/cpuinfo | head -n 1), $(nproc) cores"
  echo "kernel: $(uname -sr)"
  echo "compiler: $(c++ --version | head -n 1)"
  echo "scratch file system: $(df -T "${TMPDIR:-/tmp}" | awk 'NR == 2 { print $2 }') (${TMPDIR:-/tmp})"
  echo "commit: $(git rev-parse --short HEAD 2>/dev/null || echo unknown)$(git diff --quiet HEAD -- lib libcommon 2>/dev/null || echo ', with uncommitted changes to lib/ or libcommon/')"
} >"$results/environment.txt"

echo "=== micro-benchmarks"
build/bench/bench/micro_benchmarks --benchmark_repetitions=5 --benchmark_report_aggregates_only=true \
  --benchmark_enable_random_interleaving=true \
  --benchmark_out="$results/micro_benchmarks.json" --benchmark_out_format=json

echo "=== whole processes"
bench/compare.sh build/bench "$results" | tee "$results/compare.md"

python3 bench/render_performance.py "$results" docs/PERFORMANCE.md
echo "=== tables of docs/PERFORMANCE.md rewritten from $results/"
