#!/usr/bin/env bash
# The same micro-benchmarks of two revisions, side by side on this machine:
# builds the bench preset of REVISION in a scratch worktree, then runs its
# micro_benchmarks and this checkout's (build/bench, scripts/bench.sh
# --build-only makes it) in turns, ROUNDS times each, and prints one
# Markdown row per benchmark with both medians of real and CPU time and
# their ratio (this checkout over REVISION).
#   bench/compare_revisions.sh REVISION [FILTER [ROUNDS]]
# FILTER is a --benchmark_filter regular expression (default '^open_').
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
[ $# -ge 1 ] || { echo "usage: bench/compare_revisions.sh REVISION [FILTER [ROUNDS]]" >&2; exit 2; }
revision=$1
filter=${2:-^open_}
rounds=${3:-5}

current=$root/build/bench/bench/micro_benchmarks
[ -x "$current" ] || { echo "missing $current (scripts/bench.sh --build-only builds it)" >&2; exit 1; }

scratch=$(mktemp -d "${TMPDIR:-/tmp}/migrate-settings-revisions.XXXXXX")
cleanup() {
  git -C "$root" worktree remove --force "$scratch/tree" >/dev/null 2>&1 || true
  rm -rf "$scratch"
}
trap cleanup EXIT
git -C "$root" worktree add --detach "$scratch/tree" "$revision" >/dev/null
(cd "$scratch/tree" && cmake --preset bench >/dev/null && cmake --build --preset bench --target micro_benchmarks >/dev/null)
previous=$scratch/tree/build/bench/bench/micro_benchmarks

for round in $(seq "$rounds"); do
  for side in previous current; do
    program=${!side}
    "$program" --benchmark_filter="$filter" --benchmark_repetitions=5 --benchmark_report_aggregates_only=true \
      --benchmark_out="$scratch/$side-$round.json" --benchmark_out_format=json >/dev/null
  done
done

python3 - "$scratch" "$rounds" "$(git -C "$root" rev-parse --short "$revision")" <<'EOF'
import json, statistics, sys
scratch, rounds, revision = sys.argv[1], int(sys.argv[2]), sys.argv[3]
medians = {}
for side in ("previous", "current"):
    for round in range(1, rounds + 1):
        with open(f"{scratch}/{side}-{round}.json") as f:
            for row in json.load(f)["benchmarks"]:
                if row.get("aggregate_name") != "median":
                    continue
                name = row["run_name"]
                entry = medians.setdefault(name, {}).setdefault(side, {"real": [], "cpu": []})
                scale = {"ns": 1e-3, "us": 1.0, "ms": 1e3}[row["time_unit"]]
                entry["real"].append(row["real_time"] * scale)
                entry["cpu"].append(row["cpu_time"] * scale)
print(f"| Benchmark | {revision} real | now real | ratio | {revision} CPU | now CPU | ratio |")
print("|---|---:|---:|---:|---:|---:|---:|")
for name, sides in medians.items():
    cells = []
    for kind in ("real", "cpu"):
        before = statistics.median(sides["previous"][kind])
        after = statistics.median(sides["current"][kind])
        cells += [f"{before:,.1f} µs", f"{after:,.1f} µs", f"{after / before:.3f}"]
    print(f"| {name} | " + " | ".join(cells) + " |")
EOF
