#!/usr/bin/env bash
# Installs the Debian packages that the build needs, when missing.
#   install-deps.sh tests   also what the tests need (the simulated device is
#                           partitioned with sfdisk and formatted with mkfs.ext4;
#                           the crash exploration compares its records with
#                           strace; a program is built against the installed
#                           package with make and pkg-config)
#   install-deps.sh cross   also the ARM64 cross compiler, the emulator that
#                           runs its programs, and GoogleTest's sources to
#                           build for ARM64
#   install-deps.sh coverage  also what the tests need, and gcovr for the
#                           coverage report
#   install-deps.sh format  also clang-format
#   install-deps.sh fuzz    also clang and its libFuzzer runtime
#   install-deps.sh bench   also the micro-benchmark library, zlib (the CRC
#                           reference), sfdisk (run by every registry
#                           opening), hyperfine, and the peers and tools that
#                           bench/compare.sh runs (fw_setenv, sqlite3, GNU
#                           time, Python for the tables)
set -euo pipefail

packages=(cmake ninja-build g++ libgtest-dev)
for group in "$@"; do
  case "$group" in
    tests) packages+=(fdisk e2fsprogs strace make pkgconf) ;;
    coverage) packages+=(fdisk e2fsprogs strace make pkgconf gcovr) ;;
    cross) packages+=(g++-aarch64-linux-gnu qemu-user googletest file) ;;
    format) packages+=(clang-format) ;;
    fuzz) packages+=(clang libclang-rt-14-dev) ;;
    bench) packages+=(libbenchmark-dev zlib1g-dev fdisk hyperfine libubootenv-tool sqlite3 time python3) ;;
    *) echo "unknown package group: $group" >&2; exit 2 ;;
  esac
done

missing=()
for package in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q '^install ok installed$' || missing+=("$package")
done
[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -ne 0 ]; then
  echo "missing Debian packages: ${missing[*]} (run as root to install them)" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${missing[@]}"
