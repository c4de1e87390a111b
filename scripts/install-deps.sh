#!/usr/bin/env bash
# Installs the Debian packages that the build needs, when missing.
#   install-deps.sh tests   also what the tests need (the simulated device is
#                           partitioned with sfdisk and formatted with mkfs.ext4;
#                           the crash exploration compares its records with
#                           strace; a program is built against the installed
#                           package with make and pkg-config; the power-cut
#                           campaign's judgement is tested with Python; the
#                           Debian configure line takes dpkg-dev's flags)
#   install-deps.sh cross   also the ARM64 cross compiler, the emulator that
#                           runs its programs, and GoogleTest's sources to
#                           build for ARM64
#   install-deps.sh coverage  also what the tests need, and gcovr for the
#                           coverage report
#   install-deps.sh format  also clang-format
#   install-deps.sh fuzz    also clang and its libFuzzer runtime
#   install-deps.sh device  also what builds and boots the emulated ARM64
#                           device: qemu-system-aarch64, cpio, the file
#                           system and module tools, Python for its lists,
#                           pgrep to see that the emulator still runs;
#                           and Debian's arm64 packages become reachable
#                           (dpkg --add-architecture arm64), where the
#                           guest's kernel and programs come from
#   install-deps.sh package  also what builds the Debian packages and checks
#                           them (debhelper, lintian, autopkgtest) and what
#                           their build-time tests need
#   install-deps.sh cross-package  also Debian's arm64 cross toolchain and
#                           the arm64 libraries the cross-built packages and
#                           their tests link (arm64 becomes reachable as for
#                           device), and the emulator that runs the tests
#   install-deps.sh fresh-root  also mmdebstrap, which bootstraps a minimal
#                           Debian root from Debian's archive
#   install-deps.sh bench   also the micro-benchmark library, zlib (the CRC
#                           reference), sfdisk (run by every registry
#                           opening), hyperfine, and the peers and tools that
#                           bench/compare.sh runs (fw_setenv, sqlite3, GNU
#                           time, Python for the tables)
set -euo pipefail

packages=(cmake ninja-build g++ libgtest-dev)
arm64_packages=0
for group in "$@"; do
  case "$group" in
    device)
      packages+=(qemu-system-arm cpio fdisk e2fsprogs kmod python3 binutils procps)
      arm64_packages=1
      ;;
    tests) packages+=(fdisk e2fsprogs strace make pkgconf python3 dpkg-dev) ;;
    coverage) packages+=(fdisk e2fsprogs strace make pkgconf python3 dpkg-dev gcovr) ;;
    cross) packages+=(g++-aarch64-linux-gnu qemu-user googletest file) ;;
    package)
      packages+=(debhelper dpkg-dev fakeroot lintian autopkgtest fdisk make pkgconf python3)
      ;;
    cross-package)
      packages+=(debhelper dpkg-dev fakeroot crossbuild-essential-arm64 qemu-user make pkgconf
        libc6-dev:arm64 libstdc++-12-dev:arm64 libgtest-dev:arm64 pkgconf:arm64)
      arm64_packages=1
      ;;
    fresh-root) packages+=(mmdebstrap) ;;
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
# Whether apt knows the arm64 packages (the kernel's meta package stands for them).
arm64_known() {
  apt-cache policy linux-image-arm64:arm64 2>/dev/null | grep -q 'Candidate: [0-9]'
}
if [ ${#missing[@]} -eq 0 ] && { [ "$arm64_packages" -eq 0 ] || arm64_known; }; then
  exit 0
fi

if [ "$(id -u)" -ne 0 ]; then
  echo "missing Debian packages: ${missing[*]} (run as root to install them)" >&2
  exit 1
fi
export DEBIAN_FRONTEND=noninteractive
if [ "$arm64_packages" -eq 1 ]; then
  dpkg --print-foreign-architectures | grep -qx arm64 || dpkg --add-architecture arm64
fi
apt-get update -qq
[ ${#missing[@]} -eq 0 ] || apt-get install -y -qq --no-install-recommends "${missing[@]}"
