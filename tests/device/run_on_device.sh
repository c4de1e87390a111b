#!/usr/bin/env bash
# Runs a command inside a simulated device: a sparse 16 GiB eMMC image behind
# loop devices, seen through a private mount namespace as /dev/mmcblk0,
# /dev/mmcblk0p1 (boot, read-only at /media/boot) and /dev/mmcblk0p2
# (resources, at /media/resources), with an /etc/fstab of its own.
#
# usage: run_on_device.sh [--image-variant normal|low|badrecord|norecord|nofree]
#                         [--boot-bin FILE] [--boot0010-bin FILE]
#                         [--record HEX40] -- COMMAND [ARGS...]
#
# Exit status: the command's (128 + N when signal N ended it); 77 when the
# device cannot be simulated here (1 instead when REQUIRE_SIMULATED_DEVICE=1);
# 2 for a usage error; 1 when setting up or tearing down failed. The command
# sees SIMULATED_DEVICE=1 and SIMULATED_DEVICE_* variables naming the image,
# its loop devices and what was written (see simulated_device.h).
set -uo pipefail

readonly program=run_on_device.sh
readonly skip_status=77

# Only bash built-ins until the tools have been checked.
case "${BASH_SOURCE[0]}" in
  */*) here=${BASH_SOURCE[0]%/*} ;;
  *) here=. ;;
esac
. "$here/device_layout.sh"

usage() {
  echo "usage: $program [--image-variant normal|low|badrecord|norecord|nofree] [--boot-bin FILE] [--boot0010-bin FILE] [--record HEX40] -- COMMAND [ARGS...]" >&2
  exit 2
}

unavailable() {
  if [ "${REQUIRE_SIMULATED_DEVICE:-}" = 1 ]; then
    echo "$program: simulated device required but unavailable: $*" >&2
    exit 1
  fi
  echo "$program: skipped, simulated device unavailable: $*" >&2
  exit "$skip_status"
}

fail() {
  echo "$program: $*" >&2
  exit 1
}

variant=normal
boot_bin=
boot0010_bin=
record_override=
while [ $# -gt 0 ]; do
  case "$1" in
    --image-variant) [ $# -ge 2 ] || usage; variant=$2; shift 2 ;;
    --image-variant=*) variant=${1#*=}; shift ;;
    --boot-bin) [ $# -ge 2 ] || usage; boot_bin=$2; shift 2 ;;
    --boot0010-bin) [ $# -ge 2 ] || usage; boot0010_bin=$2; shift 2 ;;
    --record) [ $# -ge 2 ] || usage; record_override=$2; shift 2 ;;
    --) shift; break ;;
    *) usage ;;
  esac
done
[ $# -ge 1 ] || usage
case "$variant" in
  normal|badrecord|norecord) free_start=$normal_free_start ;;
  low) free_start=2048000 ;;
  nofree) free_start=0 ;;
  *) echo "$program: unknown image variant '$variant'" >&2; usage ;;
esac
if [ -n "$record_override" ]; then
  [[ "$record_override" =~ ^[0-9a-fA-F]{40}$ ]] || { echo "$program: --record needs 40 hex digits" >&2; usage; }
  [ "$variant" != nofree ] || { echo "$program: --record needs a free area" >&2; usage; }
fi

[ "$EUID" -eq 0 ] || unavailable "not running as root"

# On the emulated ARM64 device (tests/device/arm64/init.sh names its eMMC in
# /run/arm64-device) the disk is real: a variant with the card's own
# partition table is made afresh on it, record and file systems, instead of
# on loop devices. The others still get an image of their own.
real_disk=
if [ -f /run/arm64-device ]; then
  case "$variant" in normal|badrecord|norecord) read -r real_disk </run/arm64-device ;; esac
fi
for tool in unshare losetup mount umount mknod mkfs.ext4 sfdisk truncate dd stat mktemp rm sleep; do
  command -v "$tool" >/dev/null 2>&1 || unavailable "$tool not found"
done
# The product runs the partitioning tool by this path.
[ -x /usr/sbin/sfdisk ] || unavailable "/usr/sbin/sfdisk not found"
[ -d /media ] || unavailable "no /media directory to mount over"
[ -f /etc/fstab ] || unavailable "no /etc/fstab file to mount over"
[ -e /dev/loop-control ] || unavailable "no loop devices (/dev/loop-control missing)"
unshare -m --propagation private true 2>/dev/null || unavailable "unshare -m is not permitted"
for file in "$boot_bin" "$boot0010_bin"; do
  [ -z "$file" ] || [ -f "$file" ] || fail "no such file: $file"
done

scratch_root=${TMPDIR:-/tmp}
scratch_prefix=$scratch_root/simulated-device.

# The start time tells a live owner from a reused process id.
process_start() {
  local stat
  stat=$(cat "/proc/$1/stat" 2>/dev/null) || return 1
  stat=${stat##*) }
  set -- $stat
  echo "${20}"
}

# A run that was killed (SIGKILL, a test timeout) could not tidy up; its
# scratch directory names its owner and its loop devices.
sweep_abandoned() {
  local dir owner started loop
  for dir in "$scratch_prefix"*; do
    [ -f "$dir/owner" ] || continue
    read -r owner started <"$dir/owner" || continue
    [ "$(process_start "$owner")" != "$started" ] || continue
    if [ -f "$dir/loops" ]; then
      while read -r loop; do
        losetup -d "$loop" 2>/dev/null
      done <"$dir/loops"
    fi
    rm -rf "$dir"
  done
}
sweep_abandoned

scratch=$(mktemp -d "${scratch_prefix}XXXXXX") || fail "cannot create a scratch directory under $scratch_root"
image=$scratch/emmc.img
loops=()
child=

# Detaches and removes everything this run made; 0 when nothing is left.
teardown() {
  local loop left attempt status=0
  for loop in "${loops[@]}"; do
    losetup -d "$loop" || status=1
  done
  if [ -e "$image" ] && [ ${#loops[@]} -gt 0 ]; then
    # The namespace's mounts go with its last process, normally already gone.
    for attempt in 1 2 3 4 5 6 7 8 9 10; do
      left=$(losetup -n -O NAME -j "$image")
      [ -n "$left" ] || break
      sleep 0.2
    done
    if [ -n "$left" ]; then
      echo "$program: loop devices still attached to $image: $left" >&2
      status=1
    fi
  fi
  rm -rf "$scratch" || status=1
  return "$status"
}

on_signal() {
  local signal=$1
  trap '' INT TERM HUP
  if [ -n "$child" ]; then
    # Started in the background, the command ignores SIGINT; end it for sure.
    kill -TERM "$child" 2>/dev/null
    wait "$child" 2>/dev/null
    child=
  fi
  teardown
  trap - EXIT "$signal"
  kill -"$signal" $$
}

on_exit() {
  local status=$?
  trap - EXIT
  teardown || [ "$status" -ne 0 ] || status=1
  exit "$status"
}

trap on_exit EXIT
trap 'on_signal INT' INT
trap 'on_signal TERM' TERM
trap 'on_signal HUP' HUP

echo "$$ $(process_start $$)" >"$scratch/owner"
: >"$scratch/loops"

# Sets `attached`; not run in a subshell, so that `loops` keeps the device.
attach() {
  attached=$(losetup -f --show "$@" "$image") || return 1
  loops+=("$attached")
  echo "$attached" >>"$scratch/loops"
}

# Major and minor number of a block device, as "MAJOR MINOR" in decimal.
device_numbers() {
  local hex
  hex=$(stat -L -c '%t %T' "$1") || return 1
  set -- $hex
  echo "$((16#$1)) $((16#$2))"
}

if [ -n "$real_disk" ]; then
  image=$real_disk
  # The file systems are made again below; nothing may hold them meanwhile.
  for mount_point in /media/boot /media/resources; do
    if mountpoint -q "$mount_point"; then umount "$mount_point" || fail "cannot unmount $mount_point"; fi
  done
else
  truncate -s "$image_bytes" "$image" || fail "cannot create $image"
  # The third partition ends where the last free area begins.
  partition_table "$free_start" | sfdisk -q "$image" >/dev/null || fail "sfdisk could not partition $image"
fi

record=
case "$variant" in
  normal|low) record=$(make_record) ;;
  badrecord)
    record=$(make_record)
    # Header checksum intact, record checksum off by one in its high byte.
    record=${record:0:38}$(printf '%02x' $(( (16#${record:38:2} + 1) & 0xff )))
    ;;
esac
[ -z "$record_override" ] || record=$record_override
if [ -n "$record" ]; then
  write_hex "$record" "$free_start" "$image" || fail "cannot write the boot vector record"
elif [ -n "$real_disk" ]; then
  # A real disk keeps what an earlier test wrote; a fresh image reads zeros.
  write_hex "$(printf '%040d' 0)" "$free_start" "$image" || fail "cannot clear the boot vector sector"
fi

mkdir "$scratch/boot" "$scratch/resources" || fail "cannot create the partitions' contents"
if [ -n "$boot_bin" ]; then cp "$boot_bin" "$scratch/BOOT.BIN"; else default_boot_file BOOT.BIN 500 >"$scratch/BOOT.BIN"; fi || fail "cannot make BOOT.BIN"
if [ -n "$boot0010_bin" ]; then cp "$boot0010_bin" "$scratch/BOOT0010.BIN"; else default_boot_file BOOT0010.BIN 500 >"$scratch/BOOT0010.BIN"; fi || fail "cannot make BOOT0010.BIN"
cp "$scratch/BOOT.BIN" "$scratch/BOOT0010.BIN" "$scratch/boot/" || fail "cannot stage the boot files"
echo "$resources_marker_text" >"$scratch/resources/resources.id" || fail "cannot stage the resource files"

if [ -n "$real_disk" ]; then
  disk_loop=$real_disk
  boot_loop=${real_disk}p1
  resources_loop=${real_disk}p2
else
  attach || unavailable "cannot attach a loop device"
  disk_loop=$attached
  attach -o $((boot_start * sector)) --sizelimit $((boot_sectors * sector)) || fail "cannot attach the boot partition"
  boot_loop=$attached
  attach -o $((resources_start * sector)) --sizelimit $((resources_sectors * sector)) || fail "cannot attach the resource partition"
  resources_loop=$attached
fi

# No discard: on the emulated device's card it costs a minute.
mkfs.ext4 -q -F -E nodiscard -L boot -d "$scratch/boot" "$boot_loop" || fail "mkfs.ext4 failed on the boot partition"
mkfs.ext4 -q -F -E nodiscard -L resources -d "$scratch/resources" "$resources_loop" || fail "mkfs.ext4 failed on the resource partition"

cat >"$scratch/fstab" <<EOF
# simulated device
/dev/mmcblk0p1  /media/boot       ext4  ro        0  0
/dev/mmcblk0p2  /media/resources  ext4  defaults  0  0
EOF

export SIMULATED_DEVICE=1
export SIMULATED_DEVICE_VARIANT=$variant
export SIMULATED_DEVICE_DIR=$scratch
export SIMULATED_DEVICE_IMAGE=$image
export SIMULATED_DEVICE_BOOT_VECTOR_SECTOR=$free_start
export SIMULATED_DEVICE_BOOT_VECTOR_RECORD=$record
export SIMULATED_DEVICE_LOOP=$disk_loop
export SIMULATED_DEVICE_BOOT_LOOP=$boot_loop
export SIMULATED_DEVICE_RESOURCES_LOOP=$resources_loop
export SIMULATED_DEVICE_BOOT_OFFSET=$((boot_start * sector))
export SIMULATED_DEVICE_BOOT_SIZE=$((boot_sectors * sector))
export SIMULATED_DEVICE_RESOURCES_OFFSET=$((resources_start * sector))
export SIMULATED_DEVICE_RESOURCES_SIZE=$((resources_sectors * sector))
export SIMULATED_DEVICE_BOOT_BIN=$scratch/BOOT.BIN
export SIMULATED_DEVICE_BOOT0010_BIN=$scratch/BOOT0010.BIN
SIMULATED_DEVICE_NUMBERS="$(device_numbers "$disk_loop") $(device_numbers "$boot_loop") $(device_numbers "$resources_loop")" ||
  fail "cannot read the loop devices' numbers"
export SIMULATED_DEVICE_NUMBERS

# The command dies with this runner, even when the runner is killed outright.
pdeathsig=()
if command -v setpriv >/dev/null 2>&1; then pdeathsig=(setpriv --pdeathsig KILL); fi

# In the background so that a signal to this runner is handled at once;
# standard input is passed on explicitly, else it would be /dev/null.
"${pdeathsig[@]}" unshare -m --propagation private -- \
  /bin/bash "$here/device_namespace.sh" "$@" <&0 &
child=$!
wait "$child"
status=$?
child=
exit "$status"
