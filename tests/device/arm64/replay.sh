#!/bin/bash
# Block-level record and replay on the emulated device (scripts/arm64-device.sh
# replay): block_replay for each file system, two at a time (the device has
# two cores), then the broken writer; their lines on the console.
#
#   replay.sh quick   ext4 with its defaults and f2fs on a subset of the
#                     scenarios: flushes and every prefix, few reorderings
#   replay.sh full    every file system, every scenario, every kind of point
#
# The card has no volatile cache: the kernel drops every flush before it
# reaches a device stacked on it. The file system therefore lives on a
# loop device, which has a write-back cache as the device's eMMC does;
# its file, the log's and the replay's own are in memory.
set -u
. /etc/arm64-device.conf
replay=$build_dir/tests/crash/replay/block_replay
set_name=${1:-quick}
work=/tmp/replay
mkdir -p "$work"

case $set_name in
    quick)
        file_systems="ext4 f2fs"
        broken_file_systems="ext4"
        choice=(--slots=1,3 --clocks=forward --subsets=2 --torn=0)
        scenarios=(WWW BBB AAA EEE WBA BAE AEW EWB)
        ;;
    full)
        file_systems="ext4 ext4-journal ext4-writeback f2fs"
        broken_file_systems=$file_systems
        choice=(--subsets=20 --torn=4)
        scenarios=()
        ;;
    *)
        echo "@@ replay: unknown set '$set_name'"
        exit 1
        ;;
esac

# Four devices for one file system: its data, the log, the device as the
# log started and the changes of each crash point.
devices_for() {
    local name=$1 role size
    for role in data:64M log:512M origin:64M cow:64M; do
        size=${role#*:}
        role=${role%%:*}
        truncate -s "$size" "$work/$name.$role"
        losetup -f --show "$work/$name.$role"
    done
}

run_one() {
    local name=$1 start=$SECONDS
    shift
    local devices
    mapfile -t devices < <(devices_for "$name")
    mkdir -p "$work/$name"
    "$replay" "$name" "${devices[@]}" "$work/$name" "$@" 2>&1 | sed -u "s/^/@@ /"
    echo "@@ $name: ${PIPESTATUS[0]} after $((SECONDS - start)) s"
    for device in "${devices[@]}"; do losetup -d "$device"; done
    rm -f "$work/$name".*
}

start=$SECONDS
set -- $file_systems
while [ $# -gt 0 ]; do
    run_one "$1" "${choice[@]}" "${scenarios[@]}" &
    [ $# -gt 1 ] && run_one "$2" "${choice[@]}" "${scenarios[@]}" &
    wait
    shift $(($# > 1 ? 2 : 1))
done
for name in $broken_file_systems; do
    run_one "$name" --broken "${choice[@]}"
done
echo "@@ end of replay after $((SECONDS - start)) s"
