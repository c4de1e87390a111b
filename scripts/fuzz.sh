#!/bin/sh
# Builds the libFuzzer programs with clang in build/fuzz and fuzzes each
# target for a time box, starting from its committed corpus.
#   scripts/fuzz.sh [seconds per target, default 10] [target ...]
# New inputs go to build/fuzz/corpus/<target>; crashes to
# build/fuzz/findings/<target>/; the log of each run to build/fuzz/<target>.log.
set -eu

root=$(cd "$(dirname "$0")/.." && pwd)
build="$root/build/fuzz"
seconds=${1:-10}
[ $# -gt 0 ] && shift
targets=${*:-migration_checks options dual_file_target boot_vector_record}
jobs=${FUZZ_BUILD_JOBS:-2}
"$root/scripts/install-deps.sh" fuzz

CC=clang CXX=clang++ cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
for target in $targets; do
    cmake --build "$build" -j "$jobs" --target "fuzz_$target"
done

status=0
for target in $targets; do
    corpus="$build/corpus/$target"
    findings="$build/findings/$target"
    log="$build/$target.log"
    mkdir -p "$corpus" "$findings"
    # Both corpus directories are read; new inputs land in the first.
    if "$build/tests/fuzz/fuzz_$target" -max_total_time="$seconds" -print_final_stats=1 \
        -artifact_prefix="$findings/" "$corpus" "$root/tests/fuzz/corpus/$target" >"$log" 2>&1; then
        result=ok
    else
        result="FAILED (see $log and $findings)"
        status=1
    fi
    executions=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -n 1)
    if [ -z "$executions" ]; then
        executions=$(sed -n 's/^#\([0-9]*\)[[:space:]]*DONE.*/\1/p' "$log" | tail -n 1)
    fi
    printf '%-20s %12s executions in %ss  %s\n' "$target" "${executions:-?}" "$seconds" "$result"
done
exit $status
