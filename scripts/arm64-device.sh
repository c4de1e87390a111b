#!/usr/bin/env bash
# The device, emulated: an ARM64 system (qemu-system-aarch64, Debian's
# arm64 kernel) whose eMMC is an SD card over a sparse 16 GiB image.
#   arm64-device.sh build            assemble the guest and its card (build/arm64-device/)
#   arm64-device.sh test             boot it and run the whole ARM64 test suite there
#   arm64-device.sh shell            boot it with a shell on this terminal
#   arm64-device.sh power-cuts N [SEED]
#                                    cut its power N times at random moments (see power_cuts.py)
#   arm64-device.sh replay [--quick|--sample|--clock=CLOCK [--slots=N] [--scenarios=S,S...]] [FS...]
#                                    record every block write of the crash scenarios and check
#                                    every crash point of the log (tests/device/arm64/replay.sh);
#                                    --clock: the whole matrix under one clock only; --slots: of
#                                    that, the stores of N (1 or 3) slots only; --scenarios: of
#                                    that, these scenarios only (e.g. WEA,TTT); FS: only these
#                                    file systems (ext4, ext4-journal, ext4-writeback, f2fs)
#   arm64-device.sh faults [--full|--broken]
#                                    real faults of the card under the stores: reads and writes
#                                    failing, a full and a read-only file system, on ext4 and
#                                    f2fs, and under the boot file's and the resource partition's
#                                    updates (tests/device/arm64/faults.sh); CI's few cases, or
#                                    every case; each ends with a broken store that must be
#                                    caught (--broken: only that)
# test, shell, power-cuts, replay and faults build first (again only what changed). Exit
# status: 0 when everything passed; 1 otherwise (a failed test, a boot that
# did not reach its end in time, a violation).
set -euo pipefail
cd "$(dirname "$0")/.."
root=$(pwd)
out=$root/build/arm64-device
guest=$root/tests/device/arm64
kernel=$out/vmlinuz
initramfs=$out/initramfs.cpio
card=$out/card.img
assembled=$out/guest-assembled
packages=$root/build/packages/arm64

usage() {
  echo "usage: scripts/arm64-device.sh build | test | shell | power-cuts N [SEED] | replay [--quick|--sample|--clock=CLOCK [--slots=N] [--scenarios=S,...]] [FS...] | faults [--full|--broken]" >&2
  exit 2
}

# The card as the device leaves the factory: the simulated device's
# partition table with a data partition for /var/nonvolatile, the record in
# the first sector of the last free area, made without loop devices.
make_card() {
  . "$root/tests/device/device_layout.sh"
  local staging=$out/card-staging
  rm -rf "$staging" "$card.new"
  mkdir -p "$staging/boot" "$staging/resources"
  default_boot_file BOOT.BIN 500 >"$staging/boot/BOOT.BIN"
  default_boot_file BOOT0010.BIN 500 >"$staging/boot/BOOT0010.BIN"
  echo "$resources_marker_text" >"$staging/resources/resources.id"
  truncate -s "$image_bytes" "$card.new"
  partition_table "$normal_free_start" | sfdisk -q "$card.new" >/dev/null
  make_fs() {
    local start=$1 sectors=$2 label=$3 contents=$4
    mkfs.ext4 -q -F -L "$label" ${contents:+-d "$contents"} -E offset=$((start * sector)) "$card.new" \
      "$((sectors * sector / 1024))k"
  }
  make_fs "$boot_start" "$boot_sectors" boot "$staging/boot"
  make_fs "$resources_start" "$resources_sectors" resources "$staging/resources"
  make_fs "$third_start" $((normal_free_start - third_start)) nonvolatile ""
  write_hex "$(make_record)" "$normal_free_start" "$card.new"
  mv "$card.new" "$card"
  rm -rf "$staging"
}

build() {
  local start=$SECONDS
  scripts/install-deps.sh cross device
  # The test list's programs run as they are on the device, not under qemu-user.
  cmake --preset arm64-device >/dev/null
  cmake --build --preset arm64-device
  # The guest installs the tools from the arm64 packages, as a device build does.
  if packages_are_stale; then
    scripts/package.sh arm64
  fi
  if guest_is_stale; then
    ctest --preset arm64-device --show-only=json-v1 >"$out/tests.json"
    python3 "$guest/test_list.py" --time-factor 4 /usr/bin/qemu-aarch64 -L /usr/aarch64-linux-gnu \
      <"$out/tests.json" >"$out/arm64-device-tests.list"
    python3 "$guest/assemble_guest.py" "$out/guest" "$root" "$out" "$initramfs" "$kernel" $(project_debs)
    touch "$assembled"
  fi
  [ "$card" -nt tests/device/device_layout.sh ] && [ "$card" -nt "$0" ] || make_card
  echo "=== arm64-device: built in $((SECONDS - start)) s ($(sed -n 's/^# \([0-9]*\) tests$/\1/p' "$out/arm64-device-tests.list") tests)"
}

# The project's arm64 packages the guest installs.
project_debs() {
  local version
  version=$(sed -n '1s/.*(\(.*\)).*/\1/p' debian/changelog)
  echo "$packages/migrate-settings_${version}_arm64.deb" "$packages/libmigrate-settings-dev_${version}_arm64.deb"
}

# The packages are built from the tracked files: stale when one is missing
# or any of those files is newer than it, but for the ones no package build
# reads (the guest's own scripts, the other scripts, the documents).
packages_are_stale() {
  local deb newer
  for deb in $(project_debs); do
    [ -f "$deb" ] || return 0
  done
  newer=$(git ls-files -z -- . ':!tests/device/arm64' ':!scripts' ':!.ci' ':!*.md' | xargs -0 -r sh -c 'find "$@" -maxdepth 0 -newer "$0" -print -quit' "$deb" 2>/dev/null || true)
  [ -n "$newer" ]
}

# The guest holds the sources, the build's programs and the packages: it
# is stale when any of them is newer than it.
guest_is_stale() {
  [ -f "$assembled" ] || return 0
  local deb
  for deb in $(project_debs); do
    [ "$deb" -nt "$assembled" ] && return 0
  done
  local newer
  newer=$(find "$root" \( -path "$root/.git" -o -path "$out/guest" -o \
    \( -path "$root/build/*" ! -path "$out" ! -path "$out/*" \) \) -prune -o \
    -type f -newer "$assembled" \( ! -path "$out/*" -o -perm -u+x \) -print -quit)
  [ -n "$newer" ]
}

# The words that boot the guest in MODE (the kernel command line's
# arm64_device=MODE and what follows it) on the card image DISK. The card
# is written through to the image, so that what it completed survives a
# killed qemu; with CACHE "unsafe", for a card thrown away after a clean
# power-off, the host keeps its writes in its page cache (the guest sees
# the same card either way; the device tests run a third faster).
qemu_words() {
  local mode=$1 disk=$2 cache=${3:-writethrough}
  words=(qemu-system-aarch64 -M virt -cpu cortex-a53 -smp 2 -m 2048 -no-reboot -nic none -nographic
    -kernel "$kernel" -initrd "$initramfs" -append "console=ttyAMA0 panic=-1 quiet arm64_device=$mode"
    -drive if=none,id=card,file="$disk",format=raw,cache=$cache -device sdhci-pci -device sd-card,drive=card)
}

# Boots the guest in MODE on DISK, a card thrown away afterwards, the
# console on standard output; ends qemu after LIMIT seconds, or once it
# froze (then DISK.frozen says so).
boot() {
  local mode=$1 limit=$2 disk=$3 words runner watcher status
  qemu_words "$mode" "$disk" unsafe
  rm -f "$disk.frozen"
  timeout -s KILL "$limit" "${words[@]}" &
  runner=$!
  watch_for_freeze "$runner" "$disk" &
  watcher=$!
  wait "$runner" && status=0 || status=$?
  kill "$watcher" 2>/dev/null
  wait "$watcher" 2>/dev/null
  return "$status"
}

# A running guest always has work (the tests, or the campaigns' own
# watchdogs, which wake every few seconds): a qemu that used no CPU time
# for two minutes has frozen with its guest's clock, so that nothing in the
# guest can notice. Seen with qemu 7.2 in the faults campaign. Ends it and
# leaves DISK.frozen.
watch_for_freeze() {
  local runner=$1 disk=$2 qemu used last= still=0
  while kill -0 "$runner" 2>/dev/null; do
    sleep 10
    qemu=$(pgrep -P "$runner" | head -n 1) && used=$(awk '{ print $14 + $15 }' "/proc/$qemu/stat" 2>/dev/null) || continue
    if [ "$used" = "$last" ]; then still=$((still + 10)); else still=0; fi
    last=$used
    if [ "$still" -ge 120 ]; then
      echo "arm64-device: the emulator froze: no CPU time for $still s; ended" >&2
      touch "$disk.frozen"
      kill -KILL "$qemu"
      return
    fi
  done
}

# Boots as boot does, on a fresh card DISK, the console in LOG and its lines
# that match FILTER on standard output; once more, on a fresh card, when
# the emulator froze.
boot_logged() {
  local mode=$1 limit=$2 disk=$3 log=$4 filter=$5 attempt
  for attempt in 1 2; do
    fresh_card "$disk"
    boot "$mode" "$limit" "$disk" </dev/null | sed -u 's/\r$//' | tee "$log" | grep --line-buffered -E "$filter" || true
    [ -f "$disk.frozen" ] || break
    rm -f "$disk.frozen"
    [ "$attempt" = 2 ] || echo "arm64-device: booting again on a fresh card after the emulator froze"
  done
  rm -f "$disk"
}

fresh_card() {
  local copy=$1
  cp --sparse=always "$card" "$copy"
}

run_tests() {
  build
  local log=$out/test-console.log work=$out/test-card.img start=$SECONDS
  boot_logged test 3600 "$work" "$log" '^(@@ (FAILED|SKIPPED|summary|end)|arm64-device:)'
  local summary
  summary=$(grep -E '^@@ summary ' "$log" | tail -n 1)
  echo "=== arm64-device test: $((SECONDS - start)) s"
  if ! grep -q '^@@ end of tests' "$log"; then
    echo "arm64-device: the guest did not reach the end of the tests (console: $log)" >&2
    return 1
  fi
  echo "arm64-device: ${summary#@@ summary }"
  grep -E '^@@ skipped ' "$log" | sed 's/^@@ /  /' || true
  case $summary in *" failed=0") ;; *) return 1 ;; esac
}

# The replay's set: quick (a few minutes), sample (a quarter of an hour),
# full (many hours), a third of it, full-CLOCK, or a sixth, full-CLOCK-Nslot;
# with $scenarios, of a part, only those.
run_replay() {
  local set=$1 limit=$2 file_systems
  shift 2
  file_systems=$(
    IFS=,
    echo "$*"
  )
  build
  local log=$out/replay-$set${file_systems:+-${file_systems//,/-}}${scenarios:+-${scenarios//,/-}}-console.log
  local work=$out/replay-card.img start=$SECONDS
  boot_logged "replay arm64_replay=$set:$file_systems${scenarios:+:$scenarios}" "$limit" "$work" "$log" \
    '^(@@ (replay |broken writer |violation|outside the model|[a-z0-9-]+: [0-9]+ (after|devices))|arm64-device:)'
  echo "=== arm64-device replay $set: $((SECONDS - start)) s"
  if ! grep -q '^@@ end of replay' "$log"; then
    echo "arm64-device: the guest did not reach the end of the replay (console: $log)" >&2
    return 1
  fi
  if grep -E '^@@ [a-z0-9-]+: [0-9]+ after' "$log" | grep -qvE ': 0 after'; then
    echo "arm64-device: the replay found problems (console: $log)" >&2
    return 1
  fi
}

# The faults' set (bounded, full or broken) in the guest, its cases on the
# console; fails unless the store lost nothing, nothing hung or crashed and
# the broken store lost a blob.
run_faults() {
  local set=$1 limit=$2
  build
  local log=$out/faults-$set-console.log work=$out/faults-card.img start=$SECONDS
  boot_logged "faults arm64_faults=$set" "$limit" "$work" "$log" '^(@@ |arm64-device:)' | sed -u 's/^@@ //'
  echo "=== arm64-device faults $set: $((SECONDS - start)) s"
  if ! grep -q '^@@ end of faults' "$log"; then
    echo "arm64-device: the guest did not reach the end of the faults (console: $log)" >&2
    return 1
  fi
  local totals='[0-9]+ cases, [0-9]+ acknowledged, [0-9]+ lost, [0-9]+ hangs, [0-9]+ crashes$'
  if [ "$set" != broken ]; then
    grep -qE "^@@ faults: $totals" "$log" || { echo "arm64-device: no totals line (console: $log)" >&2; return 1; }
    if ! grep -qE '^@@ faults: [0-9]+ cases, [0-9]+ acknowledged, 0 lost, 0 hangs, 0 crashes$' "$log" ||
      ! grep -q '^@@ faults: 0 failed otherwise$' "$log"; then
      echo "arm64-device: the store failed under faults (console: $log)" >&2
      return 1
    fi
  fi
  if ! grep -qE "^@@ broken store: $totals" "$log" || grep -qE '^@@ broken store: [0-9]+ cases, [0-9]+ acknowledged, 0 lost' "$log"; then
    echo "arm64-device: the broken store was not caught (console: $log)" >&2
    return 1
  fi
}

case ${1:-} in
  build) mkdir -p "$out"; build ;;
  test) mkdir -p "$out"; run_tests ;;
  shell)
    mkdir -p "$out"
    build
    fresh_card "$out/shell-card.img"
    # In the foreground: qemu reads this terminal.
    qemu_words shell "$out/shell-card.img"
    "${words[@]}"
    ;;
  power-cuts)
    [ $# -ge 2 ] || usage
    mkdir -p "$out"
    build
    qemu_words @MODE@ @CARD@
    python3 "$guest/power_cuts.py" "$out" "$2" "${3:-$RANDOM}" -- "${words[@]}"
    ;;
  replay)
    mkdir -p "$out"
    shift
    set_name=full limit=86400 scenarios=
    case ${1:-} in
      --quick) set_name=quick limit=900 && shift ;;
      --sample) set_name=sample limit=7200 && shift ;;
      --clock=forward | --clock=equal | --clock=backward)
        set_name=full-${1#--clock=} limit=28800 && shift
        case ${1:-} in --slots=1 | --slots=3) set_name+=-${1#--slots=}slot limit=7200 && shift ;; esac
        case ${1:-} in --scenarios=*) scenarios=${1#--scenarios=} && shift ;; esac
        ;;
      --*) usage ;;
    esac
    for file_system in "$@"; do
      case $file_system in ext4 | ext4-journal | ext4-writeback | f2fs) ;; *) usage ;; esac
    done
    run_replay "$set_name" "$limit" "$@"
    ;;
  faults)
    mkdir -p "$out"
    case ${2:-} in
      "") run_faults bounded 900 ;;
      --full) run_faults full 14400 ;;
      --broken) run_faults broken 900 ;;
      *) usage ;;
    esac
    ;;
  *) usage ;;
esac
