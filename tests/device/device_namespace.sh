#!/usr/bin/env bash
# Second stage of run_on_device.sh, run by unshare inside the new mount
# namespace: builds the device's /dev, /media and /etc/fstab, mounts the
# partitions as the device does, then becomes the command.
set -euo pipefail

readonly program=run_on_device.sh

fail() {
  echo "$program: $*" >&2
  exit 1
}

# Decimal "MAJOR MINOR" pairs of the whole-disk, boot and resource loops.
read -r disk_major disk_minor boot_major boot_minor resources_major resources_minor \
  <<<"$SIMULATED_DEVICE_NUMBERS" || fail "loop device numbers missing"

# A fresh /dev hides the host's devices; only what programs need is made.
mount -t tmpfs -o mode=0755,size=1m simulated-dev /dev || fail "cannot mount a tmpfs over /dev"
mknod -m 0666 /dev/null c 1 3
mknod -m 0666 /dev/zero c 1 5
mknod -m 0666 /dev/full c 1 7
mknod -m 0666 /dev/random c 1 8
mknod -m 0666 /dev/urandom c 1 9
mknod -m 0666 /dev/tty c 5 0
ln -s /proc/self/fd /dev/fd
ln -s /proc/self/fd/0 /dev/stdin
ln -s /proc/self/fd/1 /dev/stdout
ln -s /proc/self/fd/2 /dev/stderr
mkdir -m 1777 /dev/shm
mount -t tmpfs -o mode=1777 simulated-shm /dev/shm || fail "cannot mount /dev/shm"
mkdir -m 0755 /dev/pts
if mount -t devpts -o newinstance,ptmxmode=0666,mode=0620 devpts /dev/pts 2>/dev/null; then
  ln -s pts/ptmx /dev/ptmx
fi

# The loop devices keep their own names too: mount and the kernel report them.
# On the ARM64 device they are the eMMC's own, made once.
make_block() {
  [ -e "$1" ] || mknod -m 0660 "$1" b "$2" "$3" || fail "cannot make $1"
}
make_block /dev/mmcblk0 "$disk_major" "$disk_minor"
make_block /dev/mmcblk0p1 "$boot_major" "$boot_minor"
make_block /dev/mmcblk0p2 "$resources_major" "$resources_minor"
make_block "$SIMULATED_DEVICE_LOOP" "$disk_major" "$disk_minor"
make_block "$SIMULATED_DEVICE_BOOT_LOOP" "$boot_major" "$boot_minor"
make_block "$SIMULATED_DEVICE_RESOURCES_LOOP" "$resources_major" "$resources_minor"

mount -t tmpfs -o mode=0755,size=16m simulated-media /media || fail "cannot mount a tmpfs over /media"
mkdir /media/boot /media/resources /media/static
mount --bind "$SIMULATED_DEVICE_DIR/fstab" /etc/fstab || fail "cannot mount the device's /etc/fstab"

# Through the fstab, as the device mounts them.
mount /media/boot || fail "cannot mount /media/boot"
mount /media/resources || fail "cannot mount /media/resources"

unset SIMULATED_DEVICE_NUMBERS
exec "$@"
