#!/bin/bash
# Runs the build's tests on the device (the list test_list.py made: t lines
# for single tests, g lines for groups of one program's cases): the ones
# that must run alone (the device tests) one after the other, beside them
# the others, two at a time, three once the device tests are done; and reports
# over the console in lines that scripts/arm64-device.sh reads:
#   @@ PASSED|FAILED|SKIPPED NAME SECONDS
#   @@ skipped NAME: REASON
#   @@ output NAME ... @@ end NAME     (a failed test's last 200 lines)
#   @@ summary run=N passed=P skipped=S failed=F
#   @@ end of tests
#   run_tests.sh LIST
# Every program started costs dearly on an emulated CPU: around a test the
# harness starts only the rename that claims it and the time limit, and
# does the rest with bash builtins.
list=$1
results=/tmp/test-results
# The tests run on the device itself: what needs one must not be skipped.
export REQUIRE_SIMULATED_DEVICE=1

# t SERIAL DEVICE NAME DIR SKIP_CODE LIMIT PASS_RE SKIP_RE WILL_FAIL COMMAND...
t() {
    local name=$3 dir=$4 skip_code=$5 limit=$6 pass_re=$7 skip_re=$8 will_fail=$9
    shift 9
    local log=$results/${name//\//_}.log started code took verdict=FAILED
    started=${EPOCHREALTIME/./}
    (cd "$dir" && exec timeout -s KILL "$limit" "$@") >"$log" 2>&1 </dev/null
    code=$?
    took=$((10#${EPOCHREALTIME/./} - 10#$started))
    if [ -n "$skip_code" ] && [ "$code" = "$skip_code" ]; then
        verdict=SKIPPED
    elif [ -n "$skip_re" ] && grep -Eq -- "$skip_re" "$log"; then
        verdict=SKIPPED
    elif [ -n "$pass_re" ]; then
        grep -Eq -- "$pass_re" "$log" && verdict=PASSED
    elif [ "$code" = 0 ]; then
        verdict=PASSED
    fi
    if [ "$will_fail" = 1 ] && [ "$verdict" != SKIPPED ]; then
        if [ "$verdict" = PASSED ]; then verdict=FAILED; else verdict=PASSED; fi
    fi
    report "$name" "$verdict" "$code" "$((took / 1000000)).$((took / 100000 % 10))"
}

# report NAME VERDICT CODE SECONDS: the verdict of one test, with the reason
# of a skip.
report() {
    local name=$1 verdict=$2 code=$3 reason
    echo "@@ $verdict $name $4"
    echo "$verdict $name $code" >>"$results/verdicts"
    if [ "$verdict" = SKIPPED ]; then
        reason=$(grep -A 1 -e ': Skipped$' "$results/${name//\//_}.log" | tail -n 1)
        [ -n "$reason" ] || reason=$(tail -n 1 "$results/${name//\//_}.log")
        echo "@@ skipped $name: $reason" | tee -a "$results/skip-reasons"
    fi
}

# g DIR LIMIT 'NAME...' COMMAND...: a GoogleTest program run once for the
# cases NAME..., each case's verdict and time read from its report and its
# own lines kept as its log. A case the report does not finish (the
# program died or ran out of time) failed, with the program's last lines.
g() {
    local dir=$1 limit=$2 names=$3
    shift 3
    local log=$results/group-$BASHPID.log code line rest name current= ms
    local -A verdict seconds
    (cd "$dir" && exec timeout -s KILL "$limit" "$@" "--gtest_filter=${names// /:}") >"$log" 2>&1 </dev/null
    code=$?
    while IFS= read -r line; do
        case $line in
            "[ RUN      ] "*)
                current=${line:13}
                : >"$results/${current//\//_}.log"
                ;;
            "[       OK ] "* | "[  FAILED  ] "* | "[  SKIPPED ] "*)
                rest=${line:13}
                name=${rest% (*}
                name=${name%%, where *}
                if [ -n "$current" ] && [ "$name" = "$current" ]; then
                    case $line in
                        "[       OK ]"*) verdict[$name]=PASSED ;;
                        "[  FAILED  ]"*) verdict[$name]=FAILED ;;
                        *) verdict[$name]=SKIPPED ;;
                    esac
                    ms=${rest##*(}
                    ms=${ms%% ms)}
                    seconds[$name]=$((ms / 1000)).$((ms / 100 % 10))
                fi
                ;;
        esac
        [ -z "$current" ] || echo "$line" >>"$results/${current//\//_}.log"
        [ -z "$current" ] || [ -z "${verdict[$current]:-}" ] || current=
    done <"$log"
    for name in $names; do
        if [ -n "${verdict[$name]:-}" ]; then
            report "$name" "${verdict[$name]}" "$code" "${seconds[$name]}"
        else
            tail -n 50 "$log" >>"$results/${name//\//_}.log"
            report "$name" FAILED "$code" 0.0
        fi
    done
}

# A worker takes the next test not yet taken, until none is left (one file
# per test; a rename claims it).
worker() {
    local test
    for test in "$results"/queue/[0-9][0-9][0-9][0-9][0-9]; do
        mv "$test" "$test.taken-by-$1" 2>/dev/null || continue
        . "$test.taken-by-$1"
    done
}

if [ "${2:-}" = --worker ]; then
    worker "$3"
    exit
fi

rm -rf "$results"
mkdir -p "$results"
: >"$results/verdicts"

# All but the device tests expect a build host: no eMMC under /dev and
# nothing under /media. Their workers run in a mount namespace of their
# own with that view: a /dev without the card's nodes, an empty /media.
host_dev=/run/host-view-dev
mkdir -p "$host_dev"
mount -t tmpfs -o mode=0755 tmpfs "$host_dev"
for node in /dev/*; do
    case ${node#/dev/} in
        mmcblk*) ;;
        pts | shm) mkdir -m 0755 "$host_dev/${node#/dev/}" ;;
        *) cp -a "$node" "$host_dev/" ;;
    esac
done
# The view lets go of the card's file systems: a mount held in another
# namespace would keep a partition busy while the device tests remake it.
as_build_host() {
    unshare -m --propagation private sh -c '
        for mounted in $(grep "^/dev/mmcblk" /proc/mounts | cut -d " " -f 2); do umount -l "$mounted"; done
        mount --bind /dev/pts "$0/pts" && mount --bind /dev/shm "$0/shm" && mount --bind "$0" /dev &&
        mount -t tmpfs -o mode=0755 tmpfs /media && exec "$@"' "$host_dev" "$@"
}

# The device tests one after the other on the card, while two workers in
# the build-host view take the others, so that the two longest (the crash
# exploration and the soak) start at once; a third joins them when the
# device tests are done. The device tests wait on the card much of the
# time, which leaves the CPUs to the workers.
grep '^t 1 ' "$list" >"$results/serial"
mkdir "$results/queue"
grep -v '^t 1 ' "$list" | split -l 1 -a 5 -d - "$results/queue/"
(
    . "$results/serial"
    as_build_host bash "$0" "$list" --worker 0
) &
lanes=$!
for worker in 1 2; do
    as_build_host bash "$0" "$list" --worker "$worker" &
    lanes="$lanes $!"
done
wait $lanes

# The output of every failed test, after all the results.
grep '^FAILED ' "$results/verdicts" | while read -r verdict name code; do
    echo "@@ output $name (exit status $code)"
    tail -n 200 "$results/${name//\//_}.log"
    echo "@@ end $name"
done
run=$(wc -l <"$results/verdicts")
passed=$(grep -c '^PASSED ' "$results/verdicts")
skipped=$(grep -c '^SKIPPED ' "$results/verdicts")
failed=$(grep -c '^FAILED ' "$results/verdicts")
echo "@@ summary run=$run passed=$passed skipped=$skipped failed=$failed"
echo "@@ end of tests"
