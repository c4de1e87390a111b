#!/bin/bash
# Real faults of the card under the stores (scripts/arm64-device.sh faults).
# The stores live on a file system (ext4, then f2fs) made on the first
# 64 MiB of the data partition behind a device-mapper device, whose table is
# switched at chosen moments: an error segment over one file's blocks (reads
# of that copy fail), flakey with error_writes (every write fails, reads
# pass), or one error segment (the power is gone: nothing more reaches the
# card). An exact step of an operation is reached by letting the operation
# stop itself before its Nth mutating call on the store (the
# fault-injection shim's FAULT_ACTION=stop), switching the table, and
# continuing it: the call then meets the kernel's own failure. The boot
# file's update and the resource partition's image write meet the same
# failing writes on their own partitions.
#
#   faults.sh bounded   CI's cases: a few steps of each operation
#   faults.sh full      every step, recovery and free-space level
#   faults.sh broken    only the broken store's cases
#
# Each set ends with cases of a broken store, whose commits ignore failed
# writes and syncs (FAULT_WRITE_ERRORS=ignore): it must lose a blob.
#
# After a fault the card recovers (the table back to linear; unmount, the
# boot's repair, mount) or loses its power during the fault (the error
# table, unmount, the device removed; the boot's repair and a mount of the
# partition itself). Then the slot must serve its last acknowledged blob or
# the one in flight, and only the new one if the operation returned 0;
# --query-present and inspect_store must agree; the next migration must
# succeed. One line a case, then the totals:
#
#   @@ case N FS OPERATION FAULT@STEP/CALLS RECOVERY: exit=S served=STATE/WHICH query=Q inspect=STATE/EXIT RESULT [log: LINES]
#   @@ faults: C cases, A acknowledged, L lost, H hangs, K crashes
#   @@ faults: F failed otherwise
#   @@ faults: S failures without a log line
#   @@ faults: B boot-file and partition updates returned 0 while the card kept the old one
#   @@ broken store: ... (the same lines)
#   @@ end of faults
#
# WHICH says whether the slot serves the blob acknowledged before the
# operation (old), the operation's own (new) or neither (other). RESULT is
# ok, lost (a slot serving neither blob, or tools that disagree),
# hang (a run past $run_limit s), crash (a run ended by a signal), failed
# (a failure without a log line, a read fault the tool did not log, or a
# next migration that failed) or, for the boot file and the partition
# image, stale.
set -u
. /etc/arm64-device.conf
set_name=${1:-bounded}
tool=$installed_tools/migrate_settings
inspect=$installed_tools/inspect_store
make_data=$build_dir/lib/storage/tools/make_example_data
driver=$build_dir/tests/lib/storage/dual_file_driver
boot_driver=$build_dir/tests/device/targets/device_target_driver
shim=$build_dir/tests/fault_injection/libfault_injection.so
part=/dev/mmcblk0p3
mnt=/var/nonvolatile
base=$mnt/app
store=$base/settings
work=/tmp/faults
ref=$work/ref
sectors=131072
run_limit=60
cases=0 acknowledged=0 lost=0 hangs=0 crashes=0 failed=0 silent=0 stale=0 reading=0 wrap=()
mkdir -p "$work"

# ---- the device under the file system ----

linear="0 $sectors linear $part 0"
writes_fail="0 $sectors flakey $part 0 0 86400 1 error_writes"
power_gone="0 $sectors error"

# table TEXT [DEVICE]: the table of DEVICE (faults) from now on. Without a
# flush or a freeze: what the file system holds in memory stays there.
table() {
    local device=${2:-faults}
    printf '%s\n' "$1" | dmsetup load "$device" && dmsetup suspend --noflush --nolockfs "$device" &&
        dmsetup resume "$device"
}

# dm_create NAME TABLE: a device-mapper device with its node; the guest
# has no udev to make it.
dm_create() {
    dmsetup create "$1" --table "$2" && dmsetup mknodes "$1"
}

mount_options() {
    case $fs in ext4) echo errors=remount-ro ;; f2fs) echo defaults ;; esac
}

# The boot's repair of DEVICE, as init.sh does it for ext4.
repair() {
    local status
    case $fs in
        ext4) e2fsck -p "$1" >"$work/fsck.log" 2>&1 ;;
        f2fs) fsck.f2fs -a "$1" >"$work/fsck.log" 2>&1 ;;
    esac
    status=$?
    [ "$status" -le 1 ] || echo "@@ repair of $1 ($fs) exited $status: $(tail -n 1 "$work/fsck.log")"
}

attach() {
    dm_create faults "$linear" && mount -t "$fs" -o "$(mount_options)" /dev/mapper/faults "$mnt"
}

make_fs() {
    umount "$mnt" 2>/dev/null
    dmsetup remove faults 2>/dev/null
    dm_create faults "$linear"
    case $fs in
        ext4) mkfs.ext4 -q -F -b 4096 -I 256 -E nodiscard,lazy_itable_init=0,lazy_journal_init=0 /dev/mapper/faults ;;
        f2fs) mkfs.f2fs -q -f -t 0 /dev/mapper/faults >/dev/null ;;
    esac
    mount -t "$fs" -o "$(mount_options)" /dev/mapper/faults "$mnt"
}

# await PID SECONDS WHAT: waits for the background job PID, which must end
# within SECONDS, or the campaign cannot go on: a process stuck in the
# kernel dies of no signal. Returns the job's status.
await() {
    local pid=$1 limit=$(($2 * 10)) waited=0
    while kill -0 "$pid" 2>/dev/null; do
        if [ "$waited" -ge "$limit" ]; then
            hangs=$((hangs + 1))
            echo "@@ $3 ($fs) did not return within $2 s: the campaign stops"
            totals
            echo "@@ end of faults after $((SECONDS - start)) s"
            exit 1
        fi
        sleep 0.1
        waited=$((waited + 1))
    done
    wait "$pid"
}

# within SECONDS COMMAND...: COMMAND under await.
within() {
    local limit=$1
    shift
    "$@" &
    await $! "$limit" "$*"
}

unmount() { within 60 umount "$1" || echo "@@ the unmount of $1 ($fs) failed"; }

# recover card|cut: the card works again and the device boots as usual, or
# the power went during the fault and the device boots on what reached it.
#
# f2fs is shut down without a sync and unmounted first, while its writes
# still fail: at its first failed write it stops writing for good (no
# checkpoint, not even at the unmount, where it would retry without end
# once the power is gone), and a table loaded under it while it handles a
# failed write could wait for ever on this kernel (the suspend waits for
# the failed write, whose completion waits for a write of its own that the
# suspend holds back). On f2fs the two recoveries then differ only in the
# device the repair and the mount see.
recover() {
    if [ "$fs" = f2fs ]; then
        within 60 f2fs_io shutdown 2 "$mnt" >/dev/null
        unmount "$mnt"
    fi
    if [ "$1" = card ]; then
        within 60 table "$linear"
        [ "$fs" = f2fs ] || unmount "$mnt"
        within 120 repair /dev/mapper/faults
        within 60 mount -t "$fs" -o "$(mount_options)" /dev/mapper/faults "$mnt"
    else
        within 60 table "$power_gone"
        [ "$fs" = f2fs ] || unmount "$mnt"
        within 60 dmsetup remove faults
        blockdev --flushbufs "$part"
        within 120 repair "$part"
        within 60 mount -t "$fs" -o "$(mount_options)" "$part" "$mnt"
    fi
}

# Back on the faults device after a recovery that mounted the partition.
reattach() {
    if ! grep -q "^/dev/mapper/faults $mnt " /proc/mounts; then
        umount "$mnt"
        attach
    fi
}

# ---- runs and what the slot serves ----

# run LOG COMMAND...: the command under the time limit, its output in LOG;
# sets $status and counts hangs and crashes.
run() {
    local log=$1
    shift
    timeout -k 5 "$run_limit" "$@" >"$log" 2>&1
    status=$?
    judge_status
}

# $status of a run: 124 and 137 are the time limit's, above 128 a signal.
# The first hang or crash of a case is its outcome.
judge_status() {
    [ "$outcome" = ok ] || return 0
    case $status in
        124 | 137) outcome=hang ;;
        129 | 1[3-9][0-9] | 2[0-9][0-9]) outcome=crash ;;
    esac
}

commit() { "$tool" --base "$1" --target settings --type simple --data "$2"; }

# state BASE: what the settings slot under BASE serves, as inspect_store
# sees it: present:CKSUM of the dumped bytes, absent-blob, empty or lost;
# its report stays in $work/inspect.log, its exit status in $work/inspect.status.
state() {
    local word
    timeout -k 5 "$run_limit" "$inspect" --base "$1" --target settings >"$work/inspect.log" 2>&1
    echo $? >"$work/inspect.status"
    word=$(awk 'NR == 1 { print $3 }' "$work/inspect.log")
    if [ "$word" = present ]; then
        timeout -k 5 "$run_limit" "$inspect" --base "$1" --target settings --dump="$work/dump" >/dev/null 2>&1
        word="present:$(cksum <"$work/dump" | cut -d ' ' -f 1)"
    fi
    echo "${word:-none}"
}

# The first log lines of a run, joined: at the default threshold only
# warnings and errors; the store driver's own report ("finalise: 5",
# "state: ...") is no log line.
log_line() {
    grep -vE '^$|^(write|writeAt|beginWrite|finalise|erase): [0-9]+$|^state: ' "$1" | head -n 2 | tr '\n' ' ' |
        sed 's/ *$//'
}

# fresh BLOB...: an empty store, then each blob committed in turn.
fresh() {
    rm -rf "$base"
    mkdir -p "$base"
    for blob in "$@"; do commit "$base" "$blob" >/dev/null 2>&1 || echo "@@ setting up: commit of $blob failed"; done
    sync
}

# check LABEL OLD NEW: judges the slot after a case whose run left $status
# and $outcome; NEW is the only state allowed when the run returned 0.
check() {
    local label=$1 old=$2 new=$3 served query inspected inspect_status allowed why steps_said which
    cases=$((cases + 1))
    served=$(state "$base")
    inspect_status=$(cat "$work/inspect.status")
    inspected=$(awk 'NR == 1 { print $3 }' "$work/inspect.log")
    run "$work/query.log" "$tool" --base "$base" --target settings --query-present
    query=$status
    allowed=" $old $new "
    [ "$op_status" -ne 0 ] || allowed=" $new "
    why=
    case $allowed in *" $served "*) ;; *) why="expected one of$allowed" ;; esac
    case $served in present:*) [ "$query" = 0 ] || why="query $query of a present slot" ;;
        *) [ "$query" = 10 ] || why="query $query of a slot not present" ;; esac
    [ "${served%%:*}" = "$inspected" ] || why="${why:+$why, }inspect_store says $inspected"
    if [ "$outcome" = ok ] && [ -n "$why" ]; then outcome=lost; fi
    if [ "$op_status" -ne 0 ] && [ -z "$(log_line "$work/op.log")" ]; then
        silent=$((silent + 1)) why="${why:+$why, }no log line says why"
        [ "$outcome" != ok ] || outcome=failed
    fi
    [ "$op_status" -ne 0 ] || [ "$reading" = 1 ] || acknowledged=$((acknowledged + 1))
    if [ "$outcome" = ok ] && [ -n "$next_blob" ]; then
        # The next migration after the fault and its recovery.
        run "$work/next.log" "$tool" --base "$base" --target settings --type simple --data "$next_blob"
        if [ "$status" -ne 0 ] || ! timeout -k 5 "$run_limit" "$inspect" --base "$base" --target settings \
            --dump="$work/dump" >/dev/null 2>&1 || ! cmp -s "$work/dump" "$next_blob"; then
            [ "$outcome" = ok ] && outcome=failed why="the next migration: exit $status, $(log_line "$work/next.log")"
        else
            acknowledged=$((acknowledged + 1))
        fi
    fi
    case $outcome in
        lost) lost=$((lost + 1)) ;;
        hang) hangs=$((hangs + 1)) ;;
        crash) crashes=$((crashes + 1)) ;;
        failed) failed=$((failed + 1)) ;;
    esac
    steps_said=$(grep -E '^(write|writeAt|beginWrite|finalise|erase): [1-9][0-9]*$' "$work/op.log" | tr '\n' ' ')
    which=other
    [ "$served" != "$new" ] || which=new
    [ "$served" != "$old" ] || which=old
    touch "$work/progress"
    echo "@@ case $cases $fs $label: exit=$op_status${steps_said:+ (${steps_said% })} served=$served/$which query=$query inspect=$inspected/$inspect_status" \
        "$outcome${why:+ ($why)}$(l=$(log_line "$work/op.log"); [ -z "$l" ] || echo " [log: $l]")"
}

present() { echo "present:$(cksum <"$1" | cut -d ' ' -f 1)"; }

# ---- the operations ----

blobs=$work/blobs
make_blobs() {
    mkdir -p "$blobs"
    local blob
    for blob in a:65535 b:40000 c:20000 next:3000; do
        "$make_data" settings "$blobs/${blob%:*}" "${blob#*:}" >/dev/null
    done
    head -c 30000 "$blobs/a" >"$blobs/part1"
    tail -c 12000 "$blobs/b" >"$blobs/part2"
}

# operation NAME BASE: the operation on the slot under BASE, its program
# started through the words of $wrap.
operation() {
    case $1 in
        commit) "${wrap[@]}" "$tool" --base "$2" --target settings --type simple --data "$blobs/c" ;;
        begun-write)
            "${wrap[@]}" "$driver" "$2/settings" 1 0 beginWrite writeAt 0 "$blobs/part1" writeAt 30000 "$blobs/part2" \
                finalise
            ;;
        erase) "${wrap[@]}" "$driver" "$2/settings" 1 0 erase ;;
    esac
}

# reference NAME: runs the operation on a copy of the stores in memory;
# sets $new (what it leaves) and $calls (its mutating calls on the store).
reference() {
    rm -rf "$ref"
    mkdir -p "$ref"
    cp -a "$base" "$ref/app"
    wrap=(env LD_PRELOAD="$shim" FAULT_CALL=mutating FAULT_PATH_SUBSTR="$ref/app/settings"
        FAULT_COUNT_FILE="$work/count")
    operation "$1" "$ref/app" >/dev/null 2>&1
    calls=$(cat "$work/count")
    new=$(state "$ref/app")
}

stopped() { grep -ls '^State:.*stopped' /proc/[0-9]*/status | sed 's|^/proc/||; s|/status$||'; }

# fault_at STEP PATH TABLE DEVICE COMMAND...: COMMAND's program (started
# through $wrap) stopped before its STEPth mutating call on PATH, DEVICE
# given TABLE there, and the program continued; STEP past its last call:
# TABLE once it has returned. Sets $status and $op_status.
fault_at() {
    local step=$1 path=$2 new_table=$3 device=$4 pid waited=0
    shift 4
    rm -f "$work/count"
    wrap=(timeout -k 5 "$run_limit" env LD_PRELOAD="$shim" FAULT_CALL=mutating FAULT_PATH_SUBSTR="$path"
        FAULT_NTH="$step" FAULT_ACTION=stop FAULT_COUNT_FILE="$work/count")
    [ "$broken" = 0 ] || wrap+=(FAULT_WRITE_ERRORS=ignore)
    "$@" >"$work/op.log" 2>&1 &
    pid=$!
    # Until the run stops itself or ends.
    while kill -0 "$pid" 2>/dev/null && [ "$waited" -lt 3000 ]; do
        [ "$(cat "$work/count" 2>/dev/null)" = "$step" ] && [ -n "$(stopped)" ] && break
        sleep 0.02
        waited=$((waited + 1))
    done
    within 60 table "$new_table" "$device"
    for stopped_pid in $(stopped); do kill -CONT "$stopped_pid"; done
    # Past its own time limit only when stuck in the kernel.
    await "$pid" $((run_limit + 30)) "the operation at step $step"
    status=$?
    op_status=$status
    judge_status
}

# update_under_fault PATH TABLE DEVICE COMMAND...: COMMAND with DEVICE's
# writes failing from its start ($step 0) or from its $step-th mutating
# call on PATH on.
update_under_fault() {
    local path=$1 new_table=$2 device=$3
    shift 3
    if [ "$step" = 0 ]; then
        table "$new_table" "$device"
        wrap=(timeout -k 5 "$run_limit")
        "$@" >"$work/op.log" 2>&1
        status=$?
        judge_status
    else
        fault_at "$step" "$path" "$new_table" "$device" "$@"
    fi
}

# ---- the cases ----

# Case 1: reads of one file of the current copy fail. On f2fs a file of 8
# bytes lives in its inode (inline data); without it the check file has a
# block of its own, and the fault is that file's alone.
read_case() {
    local file=$1 current path start end count old tool_says
    [ "$fs" = ext4 ] || mount -o remount,noinline_data "$mnt"
    fresh "$blobs/a" "$blobs/b"
    current=$("$inspect" --base "$base" --target settings | awk 'NR == 1 { print $5 }')
    path=$store/$current/data
    [ "$file" = check ] && path=$path.chk
    # Its blocks as sectors of the faults device, whole 4 KiB blocks.
    read -r start end <<<"$(filefrag -v -b512 "$path" | awk '/^ *[0-9]+: / { gsub(/\.\.|:/, " ");
        if (first == "") first = $4; last = $5 } END { print first, last }')"
    start=$((start / 8 * 8))
    count=$(((end + 8) / 8 * 8 - start))
    old=$(present "$blobs/a")
    printf '%s\n' "0 $start linear $part 0" "$start $count error" \
        "$((start + count)) $((sectors - start - count)) linear $part $((start + count))" >"$work/table"
    table "$(cat "$work/table")"
    sync
    echo 3 >/proc/sys/vm/drop_caches
    outcome=ok
    # Why the copy is not valid, before the tool's opening removes its
    # check file.
    timeout -k 5 "$run_limit" "$inspect" --base "$base" --target settings >"$work/reason.log" 2>&1
    run "$work/op.log" "$tool" --base "$base" --target settings --query-present
    op_status=$status
    tool_says=$(log_line "$work/op.log")
    [ -n "$tool_says" ] || outcome=failed
    grep -o 'copy [12]: [a-z ]*unreadable: [A-Za-z/ ]*' "$work/reason.log" >>"$work/op.log"
    # Served while the fault lasts: the other copy, as acknowledged before.
    next_blob= reading=1
    check "read-$file copy-$current@$start+$count none" "$old" "$old"
    reading=0
    table "$linear"
    sync
    echo 3 >/proc/sys/vm/drop_caches
    echo "@@ case $cases: the tool's log: ${tool_says:-nothing}; once the card reads again, served=$(state "$base")" \
        "(the newest, acknowledged: $(present "$blobs/b"))"
    [ "$fs" = ext4 ] || mount -o remount,inline_data "$mnt"
}

# Case 2: the card fails every write from a step of an operation on.
write_case() {
    local name=$1 step=$2 recovery=$3 old
    fresh "$blobs/a" "$blobs/b"
    old=$(present "$blobs/b")
    outcome=ok
    fault_at "$step" "$store" "$writes_fail" faults operation "$name" "$base"
    recover "$recovery"
    next_blob=$blobs/next
    check "$name writes-fail@$step/$calls $recovery" "$old" "$new"
    reattach
}

# Case 3: the file system full but for FREE blocks, or read-only. The
# filler takes every block it can (as root, who may use the blocks ext4
# keeps for root), beside a spare file of FREE blocks that is then removed.
fill() {
    local size filler=0
    [ "$1" = 0 ] || fallocate -l $(($1 * 4096)) "$mnt/spare"
    size=$(($(stat -f -c %f "$mnt") * 4096))
    while [ "$size" -ge 4096 ]; do
        if fallocate -l "$size" "$mnt/filler$filler" 2>/dev/null; then
            filler=$((filler + 1))
        else
            rm -f "$mnt/filler$filler"
            size=$((size / 2))
        fi
    done
    rm -f "$mnt/spare"
    sync
}

space_case() {
    local free=$1 old
    fresh "$blobs/a"
    old=$(present "$blobs/a")
    reference commit
    if [ "$free" = ro ]; then mount -o remount,ro "$mnt"; else fill "$free"; fi
    outcome=ok
    run "$work/op.log" "$tool" --base "$base" --target settings --type simple --data "$blobs/c"
    op_status=$status
    if [ "$free" = ro ]; then
        mount -o remount,rw "$mnt"
    else
        rm -f "$mnt"/filler*
        sync
    fi
    next_blob=$blobs/next
    check "commit $([ "$free" = ro ] && echo read-only || echo "full-but-$free-blocks") none" "$old" "$new"
}

# Case 4: the boot file rewritten while the card fails writes, from
# before the update (STEP 0) or from its STEPth mutating call on the boot
# file on, then RECOVERY. A file that is neither the old nor the new one
# needs a failed update (else: lost); an update that returned 0 while the
# card kept the old file is counted apart, as stale.
# judge_update WHAT: counts an update of the boot file or the partition
# that ended with $op_status and left $served (new, old or neither), WHAT
# saying what it left; an update that returned 0 over anything but the new
# content is stale (the old one) or lost. Sets why and outcome.
judge_update() {
    cases=$((cases + 1))
    touch "$work/progress"
    why=
    if [ "${op_status:-none}" = 0 ]; then
        acknowledged=$((acknowledged + 1))
        [ "$served" = new ] || why="finalise returned 0, $1"
    fi
    if [ "$outcome" = ok ] && [ -n "$why" ]; then
        if [ "$served" = old ]; then outcome=stale stale=$((stale + 1)); else outcome=lost lost=$((lost + 1)); fi
    fi
}

boot_update() { "${wrap[@]}" "$boot_driver" boot-update 0 "$work/boot-new"; }

boot_case() {
    local step=$1 recovery=$2 size old_sum new_sum served why boot_linear
    umount /media/boot
    size=$(blockdev --getsz /dev/mmcblk0p1)
    boot_linear="0 $size linear /dev/mmcblk0p1 0"
    dm_create bootfaults "$boot_linear"
    mount -o ro /dev/mapper/bootfaults /media/boot
    cp /media/boot/BOOT.BIN "$work/boot-old"
    "$make_data" settings "$work/boot-new" 5000 >/dev/null
    old_sum=$(cksum <"$work/boot-old" | cut -d ' ' -f 1)
    new_sum=$(cksum <"$work/boot-new" | cut -d ' ' -f 1)
    outcome=ok
    update_under_fault /media/boot/BOOT.BIN "0 $size flakey /dev/mmcblk0p1 0 0 86400 1 error_writes" bootfaults \
        boot_update
    op_status=$(sed -n 's/^finalise \([0-9]*\) .*/\1/p' "$work/op.log")
    if [ "$recovery" = cut ]; then table "0 $size error" bootfaults; else table "$boot_linear" bootfaults; fi
    unmount /media/boot
    dmsetup remove bootfaults
    blockdev --flushbufs /dev/mmcblk0p1
    fs=ext4 repair /dev/mmcblk0p1
    mount -o ro /dev/mmcblk0p1 /media/boot
    case $(cksum </media/boot/BOOT.BIN | cut -d ' ' -f 1) in
        "$new_sum") served=new ;;
        "$old_sum") served=old ;;
        *) served=neither ;;
    esac
    judge_update "the boot file is the $served one"
    echo "@@ case $cases ext4 boot-file writes-fail@$step $recovery: finalise=${op_status:-none} served=$served" \
        "$outcome${why:+ ($why)} [log: $(grep -E 'Readback|Failed|failed' "$work/op.log" | head -n 3 | tr '\n' ' ' | sed 's/ *$//')]"
    # The old file back for the next case.
    if [ "$served" != old ]; then
        mount -o remount,rw /media/boot && cp "$work/boot-old" /media/boot/BOOT.BIN && sync
        mount -o remount,ro /media/boot
    fi
}

# Case 5: the resource partition's image written while the card fails
# writes, from before the update (STEP 0) or from its STEPth mutating call
# on the device on, then RECOVERY; judged as the boot file. The product
# writes the fixed /dev/mmcblk0p2: in a mount namespace of the update's own
# that node is the faults device's (a bind mount), and /media/resources is
# mounted from it.
partition_update() {
    unshare -m sh -c 'mount --bind "$1" /dev/mmcblk0p2 && mount "$1" /media/resources && shift && exec "$@"' \
        sh /dev/mapper/partfaults "${wrap[@]}" "$boot_driver" partition-update "$work/part-new"
}

# The resource partition's marker: new, old or neither.
resources_marker() {
    mount -o ro /dev/mmcblk0p2 /media/resources 2>/dev/null || { echo neither; return; }
    case $(cat /media/resources/resources.id 2>/dev/null) in
        "faulted resources") echo new ;;
        "simulated resource partition") echo old ;;
        *) echo neither ;;
    esac
    umount /media/resources
}

partition_case() {
    local step=$1 recovery=$2 size served why part_linear attempt
    size=$(blockdev --getsz /dev/mmcblk0p2)
    part_linear="0 $size linear /dev/mmcblk0p2 0"
    if [ ! -f "$work/part-new" ]; then
        umount /media/resources 2>/dev/null
        # The update's image: a smaller ext4 whose marker differs; only its
        # 8 MiB of the partition change, and are put back after each case.
        mkdir -p "$work/part-root"
        echo "faulted resources" >"$work/part-root/resources.id"
        mkfs.ext4 -q -F -b 4096 -d "$work/part-root" -E nodiscard "$work/part-new" 8M
        dd if=/dev/mmcblk0p2 of="$work/part-old" bs=1M count=8 2>/dev/null
    fi
    dm_create partfaults "$part_linear"
    outcome=ok
    update_under_fault /dev/mmcblk0p2 "0 $size flakey /dev/mmcblk0p2 0 0 86400 1 error_writes" partfaults \
        partition_update
    op_status=$(sed -n 's/^finalise \([0-9]*\)$/\1/p' "$work/op.log")
    if [ "$recovery" = cut ]; then table "0 $size error" partfaults; else table "$part_linear" partfaults; fi
    # The namespace's mount goes with its last process, not at once.
    for attempt in 1 2 3 4 5 6 7 8 9 10; do
        dmsetup remove partfaults 2>/dev/null && break
        sleep 0.5
    done
    blockdev --flushbufs /dev/mmcblk0p2
    fs=ext4 repair /dev/mmcblk0p2
    served=$(resources_marker)
    judge_update "the partition holds the $served image"
    echo "@@ case $cases ext4 partition-image writes-fail@$step $recovery: finalise=${op_status:-none}" \
        "served=$served $outcome${why:+ ($why)} [log: $(grep -E 'Failed|failed|rror' "$work/op.log" | head -n 2 |
            tr '\n' ' ' | sed 's/ *$//')]"
    [ "$served" = old ] || dd if="$work/part-old" of=/dev/mmcblk0p2 bs=1M conv=fsync 2>/dev/null
}

partition_steps() {
    case $set_name in
        full) echo 0:cut 1:cut 2:cut 2:card 1025:cut 2050:cut ;;
        bounded) echo 2:cut ;;
    esac
}

boot_steps() {
    case $set_name in
        full) for step in 0 1 2 3 4; do echo "$step:card" "$step:cut"; done ;;
        bounded) echo 0:cut 2:cut ;;
    esac
}

# steps CALLS: the steps of an operation of CALLS mutating calls that the
# set runs, each with its recovery; the broken store's bounded set only its
# commit's last two calls (the rename and the sync of the file system).
steps() {
    local calls=$1 step
    if [ "$broken" = 1 ]; then
        case $set_name in
            full) for step in $(seq 1 "$calls"); do echo "$step:cut"; done ;;
            bounded) echo "$((calls - 1)):cut" "$calls:cut" ;;
        esac
        return
    fi
    case $set_name in
        full) for step in $(seq 1 $((calls + 1))); do echo "$step:card" "$step:cut"; done ;;
        bounded)
            # Every operation at its middle step, the card recovering; the
            # commit also before its first call and after its last, cut.
            echo "$(((calls + 1) / 2)):card"
            [ "$operation_name" != commit ] || echo "1:cut" "$((calls + 1)):cut"
            ;;
    esac
}

read_files() {
    case $set_name in
        full) echo data check ;;
        bounded) [ "$fs" = ext4 ] && echo data || echo check ;;
    esac
}

space_levels() {
    case $set_name in
        full) echo ro $(seq 0 8) ;;
        bounded) echo ro 0 ;;
    esac
}

# campaign NAME: every case of the set on ext4 and f2fs, and the boot file;
# the broken store's commits on ext4 only. Its totals line starts with NAME.
campaign() {
    name=$1
    local operations="commit begun-write erase" file_systems="ext4 f2fs"
    cases=0 acknowledged=0 lost=0 hangs=0 crashes=0 failed=0 silent=0 stale=0
    [ "$broken" = 0 ] || operations=commit file_systems=ext4
    for fs in $file_systems; do
        make_fs
        if [ "$broken" = 0 ]; then
            for file in $(read_files); do read_case "$file"; done
        fi
        for operation_name in $operations; do
            fresh "$blobs/a" "$blobs/b"
            reference "$operation_name"
            for choice in $(steps "$calls"); do write_case "$operation_name" "${choice%%:*}" "${choice#*:}"; done
        done
        if [ "$broken" = 0 ]; then
            for free in $(space_levels); do space_case "$free"; done
        fi
        umount "$mnt"
        dmsetup remove faults
    done
    if [ "$broken" = 0 ]; then
        for choice in $(boot_steps); do boot_case "${choice%%:*}" "${choice#*:}"; done
        for choice in $(partition_steps); do partition_case "${choice%%:*}" "${choice#*:}"; done
    fi
    totals
}

totals() {
    echo "@@ $name: $cases cases, $acknowledged acknowledged, $lost lost, $hangs hangs, $crashes crashes"
    echo "@@ $name: $failed failed otherwise"
    echo "@@ $name: $silent failures without a log line"
    echo "@@ $name: $stale boot-file and partition updates returned 0 while the card kept the old one"
}

# A case takes seconds. Whatever holds the campaign in the kernel for
# longer (a program the time limits cannot end, a sync, an unmount) is
# shown with its kernel stack, and the campaign ends as a hang.
stall_limit=180
watch_for_stalls() {
    local pid
    while sleep 10; do
        [ $(($(date +%s) - $(stat -c %Y "$work/progress"))) -ge "$stall_limit" ] || continue
        echo "@@ faults: no case ended for $stall_limit s; the programs, and the kernel's stack of each waiting in it:"
        for pid in $(ls /proc | grep -E '^[0-9]+$'); do
            [ -s "/proc/$pid/cmdline" ] || continue
            echo "@@   $pid $(awk '{ print $3 }' "/proc/$pid/stat") $(tr '\0' ' ' <"/proc/$pid/cmdline")"
            [ "$(awk '{ print $3 }' "/proc/$pid/stat")" != D ] || sed 's/^/@@     /' "/proc/$pid/stack"
        done 2>/dev/null
        echo "@@ faults: the kernel's last words:"
        dmesg | tail -n 30 | sed 's/^/@@   /'
        sync &
        sleep 2
        poweroff -f
    done
}

case $set_name in bounded | full | broken) ;; *)
    echo "@@ faults: unknown set '$set_name'"
    exit 1
    ;;
esac
start=$SECONDS
touch "$work/progress"
watch_for_stalls &
umount "$mnt" || echo "@@ faults: cannot unmount $mnt"
make_blobs
if [ "$set_name" != broken ]; then
    broken=0
    campaign faults
fi
set_name=${set_name/broken/full}
broken=1
campaign "broken store"
echo "@@ end of faults after $((SECONDS - start)) s"
