#!/bin/bash
# Block-level record and replay on the emulated device (scripts/arm64-device.sh
# replay): block_replay for each file system, two at a time (the device has
# two cores), then the broken writer; their lines on the console.
#
#   replay.sh quick   ext4 with its defaults and f2fs on a subset of the
#                     scenarios: flushes and every prefix, few reorderings
#   replay.sh sample  every file system and every kind of point on four
#                     scenarios, one and three slots
#   replay.sh full    every file system, every scenario, every kind of point
#   replay.sh full-CLOCK
#                     the same, under one clock (forward, equal or backward):
#                     a third of it
#   replay.sh full-CLOCK-Nslot
#                     of that, the stores of N (1 or 3) slots: a sixth
#   replay.sh SET:FS,FS...[:SCENARIO,SCENARIO...]
#                     a set on these file systems only (none named: all of
#                     the set's), and of its scenarios only these
#
# The card has no volatile cache: the kernel drops every flush before it
# reaches a device stacked on it. The file system therefore lives on a
# loop device, which has a write-back cache as the device's eMMC does;
# its file and the log's are in memory, the replay's own devices RAM disks.
set -u
. /etc/arm64-device.conf
replay=$build_dir/tests/crash/replay/block_replay
set_name=${1:-quick}
chosen_file_systems=
chosen_scenarios=
case $set_name in *:*)
    chosen_file_systems=${set_name#*:}
    set_name=${set_name%%:*}
    ;;
esac
case $chosen_file_systems in *:*)
    chosen_scenarios=${chosen_file_systems#*:}
    chosen_file_systems=${chosen_file_systems%%:*}
    ;;
esac
work=/tmp/replay
mkdir -p "$work"

case $set_name in
    quick)
        file_systems="ext4 f2fs"
        broken_file_systems="ext4"
        choice=(--slots=1,3 --clocks=forward --subsets=2 --torn=0)
        scenarios=(WWW EEE WBA BAE AEW EWB TTT)
        ;;
    sample)
        file_systems="ext4 ext4-journal ext4-writeback f2fs"
        broken_file_systems=$file_systems
        choice=(--slots=1,3 --clocks=forward --subsets=20 --torn=4)
        scenarios=(WBA BAE AEW EWB)
        ;;
    full | full-forward | full-equal | full-backward | full-*-[13]slot)
        file_systems="ext4 ext4-journal ext4-writeback f2fs"
        broken_file_systems=$file_systems
        choice=(--subsets=20 --torn=4)
        part=${set_name#full}
        case $part in
            *slot)
                slots=${part##*-}
                choice+=("--slots=${slots%slot}")
                part=${part%-*}
                ;;
        esac
        [ -z "$part" ] || choice+=("--clocks=${part#-}")
        scenarios=()
        ;;
    *)
        echo "@@ replay: unknown set '$set_name'"
        exit 1
        ;;
esac
if [ -n "$chosen_file_systems" ]; then
    file_systems=${chosen_file_systems//,/ }
    broken_file_systems=$file_systems
fi
[ -z "$chosen_scenarios" ] || read -ra scenarios <<<"${chosen_scenarios//,/ }"

# The devices of one file system, the NUMBER-th of a pair (0 or 1): its
# data and the log on loop devices (made one after the other: two searches
# for a free device at once may find the same), the device as the log
# started and two for the changes of the crash points' devices, in turn,
# on RAM disks, which answer at once where a loop device hands every
# request to a thread. Their names go to $work/NAME.devices.
make_devices() {
    local name=$1 number=$2 role size disk
    : >"$work/$name.devices"
    for role in data:64M log:512M; do
        size=${role#*:}
        role=${role%%:*}
        truncate -s "$size" "$work/$name.$role"
        losetup -f --show "$work/$name.$role" >>"$work/$name.devices"
    done
    for disk in 0 1 2; do echo "/dev/ram$((number * 3 + disk))" >>"$work/$name.devices"; done
}

run_one() {
    local name=$1 start=$SECONDS line devices
    shift
    mapfile -t devices <"$work/$name.devices"
    mkdir -p "$work/$name"
    "$replay" "$name" "${devices[@]:0:3}" "${devices[3]},${devices[4]}" "$work/$name" "$@" 2>&1 |
        while IFS= read -r line; do echo "@@ $line"; done
    echo "@@ $name: ${PIPESTATUS[0]} after $((SECONDS - start)) s"
}

free_devices() {
    local name=$1 device
    while read -r device; do
        case $device in /dev/loop*) losetup -d "$device" ;; esac
    done <"$work/$name.devices"
    rm -rf "$work/$name" "$work/$name".*
}

# Six RAM disks as large as the data device: three for each of a pair.
modprobe brd rd_nr=6 rd_size=65536 || echo "@@ replay: cannot load brd"
start=$SECONDS
set -- $file_systems
while [ $# -gt 0 ]; do
    pair="$1 ${2:-}"
    number=0
    for name in $pair; do
        make_devices "$name" $number
        number=$((number + 1))
    done
    for name in $pair; do run_one "$name" "${choice[@]}" "${scenarios[@]}" & done
    wait
    for name in $pair; do free_devices "$name"; done
    shift $(($# > 1 ? 2 : 1))
done
for name in $broken_file_systems; do
    make_devices "$name" 0
    run_one "$name" --broken "${choice[@]}"
    free_devices "$name"
done
echo "@@ end of replay after $((SECONDS - start)) s"
