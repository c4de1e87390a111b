#!/bin/busybox sh
# The emulated ARM64 device's first process: the mounts every Linux system
# has, the eMMC's driver and the file systems, the card's partitions checked
# and mounted as /etc/fstab says, then what the kernel command line asks for with
# arm64_device=MODE:
#   test      run the test list, report over the console, power off
#   shell     an interactive shell on the console; power off when it ends
#   workload  the power-cut workload, until the host cuts the power
#   verify    print what every store of the workload holds, power off
#   replay    record and replay block writes (replay.sh), with
#             arm64_replay=quick|full, report over the console, power off
#   faults    real faults of the card under the stores (faults.sh), with
#             arm64_faults=bounded|full|broken, report, power off
/bin/busybox --install -s
export PATH=/usr/sbin:/usr/bin:/sbin:/bin
export HOME=/root

mount -t proc proc /proc
mount -t sysfs sysfs /sys
mount -t devtmpfs devtmpfs /dev
mkdir -p /dev/pts /dev/shm
mount -t devpts devpts /dev/pts
mount -t tmpfs -o mode=1777 tmpfs /dev/shm
# /tmp and /run stay on the initramfs (a tmpfs already): the checkout keeps
# its build host's path here, which may lie below either, and a mount there
# would hide it.
chmod 1777 /tmp
# Only the kernel's errors on the console: the tests report over it.
dmesg -n 1
# A device whose init does not turn it on: any user may hard-link any file
# it can reach, and the tests plant such links as an application would.
echo 0 >/proc/sys/fs/protected_hardlinks

. /etc/arm64-device.conf
for module in $modules; do
    modprobe "$module" || echo "arm64-device: cannot load $module"
done
# The card's partitions appear once the host controller has probed it.
waited=0
while [ ! -b /dev/mmcblk0p3 ] && [ "$waited" -lt 200 ]; do
    sleep 0.05
    waited=$((waited + 1))
done
# As the device's boot does, e2fsck repairs the file systems /etc/fstab
# gives a pass number before they are mounted: after a power cut during a
# journal commit, this kernel refuses to mount ("Structure needs
# cleaning") until the torn transaction is dropped.
while read -r device directory type options dump pass; do
    case $device in /dev/*) ;; *) continue ;; esac
    [ "$type" = ext4 ] && [ "${pass:-0}" -gt 0 ] || continue
    e2fsck -p "$device" >/tmp/e2fsck.log 2>&1
    status=$?
    [ "$status" -eq 0 ] && continue
    echo "arm64-device: e2fsck -p $device exited $status:"
    sed 's/^/arm64-device:   /' /tmp/e2fsck.log
done </etc/fstab
mount -a || echo "arm64-device: not every file system of /etc/fstab could be mounted"
# Tests that need the simulated device use this eMMC instead of loop devices.
echo /dev/mmcblk0 >/run/arm64-device
# The tools come from the project's packages, installed as a device build
# installs them; everything below runs those. By its path: this shell
# prefers busybox's own dpkg to PATH.
if ! /usr/bin/dpkg -i "$packages"/*.deb >/tmp/dpkg-install.log 2>&1; then
    echo "arm64-device: installing the packages failed:"
    sed 's/^/arm64-device:   /' /tmp/dpkg-install.log
fi

mode=
replay_set=
faults_set=
for word in $(cat /proc/cmdline); do
    case $word in
        arm64_device=*) mode=${word#arm64_device=} ;;
        arm64_replay=*) replay_set=${word#arm64_replay=} ;;
        arm64_faults=*) faults_set=${word#arm64_faults=} ;;
    esac
done
echo "arm64-device: ready after $(cut -d ' ' -f 1 /proc/uptime) s, mode ${mode:-none}"

guest=$source_dir/tests/device/arm64
case $mode in
    test) bash "$guest/run_tests.sh" "$build_dir/arm64-device-tests.list" ;;
    shell) setsid cttyhack sh -l ;;
    workload) sh "$guest/workload.sh" ;;
    verify) sh "$guest/workload.sh" verify ;;
    replay) bash "$guest/replay.sh" "$replay_set" ;;
    faults) bash "$guest/faults.sh" "$faults_set" ;;
    *) echo "arm64-device: unknown mode '$mode'" ;;
esac
cd /
sync
umount -a -r 2>/dev/null
poweroff -f
