# The device's eMMC as the simulated device and the emulated ARM64 device
# both lay it out, sourced by run_on_device.sh and scripts/arm64-device.sh:
# partitions, the boot-vector record, the boot files' default contents.

readonly sector=512
# Partition layout in sectors.
readonly boot_start=2048 boot_sectors=131072              # 64 MiB
readonly resources_start=133120 resources_sectors=262144  # 128 MiB
readonly third_start=395264
readonly image_bytes=$((16 * 1024 * 1024 * 1024))
# The last free area, whose first sector holds the record.
readonly normal_free_start=30703616

# Prints the 20-byte record for value 0x01020304 as hex, checksums included.
make_record() {
  local -a b=(0x01 0x02 0x03 0x04 0x53 0x49 0x4d 0x01 0
              0x00 0x11 0x22 0x33 0x44 0x55 0x66 0x77 0x88 0 0)
  local i sum=0 c=0
  for i in 0 1 2 3 4 5 6 7; do sum=$((sum + b[i])); done
  b[8]=$((sum & 0xff))
  for ((i = 0; i < 18; i++)); do
    c=$(( ((c >> 1) | ((c & 1) << 15)) + b[i] ))
    c=$((c & 0xffff))
  done
  b[18]=$((c & 0xff))
  b[19]=$((c >> 8))
  printf '%02x' "${b[@]}"
}

# Writes hex bytes at a sector of a file or device.
write_hex() {
  local hex=$1 offset_sectors=$2 target=$3
  printf "$(sed 's/../\\x&/g' <<<"$hex")" |
    dd of="$target" bs="$sector" seek="$offset_sectors" conv=notrunc status=none
}

# The boot files' default contents: text lines, sizes not a block multiple.
default_boot_file() {
  local name=$1 lines=$2 i
  for ((i = 1; i <= lines; i++)); do printf '%s line %05d\n' "$name" "$i"; done
}

readonly resources_marker_text="simulated resource partition"

# The partition table for a last free area at `free_start` (0: none), as
# sfdisk reads it.
partition_table() {
  local free_start=$1
  echo "label: dos"
  echo "start=$boot_start, size=$boot_sectors, type=83"
  echo "start=$resources_start, size=$resources_sectors, type=83"
  if [ "$free_start" -eq 0 ]; then
    echo "start=$third_start, type=83"
  else
    echo "start=$third_start, size=$((free_start - third_start)), type=83"
  fi
}
