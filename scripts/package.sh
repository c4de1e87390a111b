#!/usr/bin/env bash
# Builds and checks the Debian packages (debian/) from the checkout's
# tracked files, in build/packages/<architecture>/.
#   package.sh [native]    the source package and the amd64 (build machine's)
#                          packages with the build-time tests, then lintian,
#                          which fails on any error or warning
#   package.sh arm64       the arm64 packages, cross-built, with the tests
#                          run under qemu-user, then lintian
#   package.sh autopkgtest the autopkgtests (debian/tests) of the native
#                          packages on this machine (installs them here)
#   package.sh arm64-consumer  the consumer program cross-built against the
#                          arm64 libmigrate-settings-dev, run under qemu-user
# autopkgtest and arm64-consumer use the packages the first two left.
set -euo pipefail
cd "$(dirname "$0")/.."
mode=${1:-native}
out=$PWD/build/packages
version=$(dpkg-parsechangelog -l debian/changelog -S Version 2>/dev/null || sed -n '1s/.*(\(.*\)).*/\1/p' debian/changelog)

# A clean tree of the tracked files: nothing of build/ reaches the source
# package, and the checkout is never written.
export_tree() {
  local dir=$1/migrate-settings-$version
  rm -rf "$1"
  mkdir -p "$dir"
  git ls-files -z | tar --null -T - -cf - | tar -xf - -C "$dir"
  echo "$dir"
}

# Warnings of the compiler and the linker under the distribution's flags
# (hardening, fortified functions) are defects too; the build tools' own
# notices are not.
no_compiler_warnings() {
  if grep -n 'warning:' "$1" | grep -vE '^[0-9]+:(dh|dpkg-[a-z]+): warning:'; then
    echo "the package build warns (above)" >&2
    return 1
  fi
}

case $mode in
  native)
    scripts/install-deps.sh package
    tree=$(export_tree "$out/amd64")
    (cd "$tree" && dpkg-buildpackage -us -uc -j2 >../build.log 2>&1) || {
      tail -n 80 "$out/amd64/build.log"
      exit 1
    }
    no_compiler_warnings "$out/amd64/build.log"
    grep -E '^[0-9]+% tests passed' "$out/amd64/build.log"
    changes=$(ls "$out"/amd64/migrate-settings_"$version"_*.changes)
    lintian --fail-on error,warning --info "$changes"
    ls -l "$out"/amd64/*.deb
    ;;
  arm64)
    scripts/install-deps.sh cross-package
    tree=$(export_tree "$out/arm64")
    # The tests run under qemu-user (debian/rules), which dh is told.
    (cd "$tree" && CC=aarch64-linux-gnu-gcc CXX=aarch64-linux-gnu-g++ \
      DEB_BUILD_OPTIONS="crossbuildcanrunhostbinaries ${DEB_BUILD_OPTIONS:-}" \
      dpkg-buildpackage -a arm64 -Pcross -B -us -uc -j2 >../build.log 2>&1) || {
      tail -n 80 "$out/arm64/build.log"
      exit 1
    }
    no_compiler_warnings "$out/arm64/build.log"
    grep -E '^[0-9]+% tests passed' "$out/arm64/build.log"
    lintian --fail-on error,warning --info "$out"/arm64/migrate-settings_"$version"_arm64.changes
    for deb in "$out"/arm64/*_arm64.deb; do
      dpkg-deb -f "$deb" Package Architecture
    done
    scratch=$(mktemp -d /tmp/migrate-settings-arm64.XXXXXX)
    trap 'rm -rf "$scratch"' EXIT
    dpkg-deb -x "$out/arm64/migrate-settings_${version}_arm64.deb" "$scratch"
    file -L "$scratch/usr/bin/migrate_settings" | grep -q ', ARM aarch64, ' ||
      { echo "not an ARM64 program: $(file -L "$scratch/usr/bin/migrate_settings")" >&2; exit 1; }
    ;;
  autopkgtest)
    scripts/install-deps.sh package
    changes=$(ls "$out"/amd64/migrate-settings_"$version"_*.changes)
    # autopkgtest installs the packages on this machine; what it installed
    # goes again afterwards.
    installed=$(dpkg-query -W -f='${Package} ${Status}\n' migrate-settings libmigrate-settings-dev 2>/dev/null |
      sed -n 's/ install ok installed$//p' || true)
    status=0
    autopkgtest "$changes" -- null || status=$?
    for package in migrate-settings libmigrate-settings-dev; do
      grep -qx "$package" <<<"$installed" || dpkg --purge "$package" >/dev/null 2>&1 || true
    done
    exit "$status"
    ;;
  arm64-consumer)
    scripts/install-deps.sh cross-package
    scratch=$(mktemp -d /tmp/migrate-settings-arm64-consumer.XXXXXX)
    trap 'rm -rf "$scratch"' EXIT
    root=$scratch/root
    dpkg-deb -x "$out/arm64/libmigrate-settings-dev_${version}_arm64.deb" "$root"
    libdir=$root/usr/lib/aarch64-linux-gnu
    # With the project's toolchain file, packages are looked for in the
    # cross sysroot only: the package directory is named.
    cmake -G Ninja -DCMAKE_TOOLCHAIN_FILE="$PWD/cmake/aarch64-linux-gnu.cmake" \
      -Dmigrate_settings_DIR="$libdir/cmake/migrate_settings" \
      -S tests/consumer -B "$scratch/cmake" >"$scratch/configure.log" || { cat "$scratch/configure.log"; exit 1; }
    cmake --build "$scratch/cmake"
    mkdir "$scratch/make"
    # The .pc file says /usr, as in a sysroot; the sysroot is the unpacked package.
    PKG_CONFIG_LIBDIR=$libdir/pkgconfig PKG_CONFIG_SYSROOT_DIR=$root PKG_CONFIG_PATH='' \
      make -s -f "$PWD/tests/consumer/Makefile" -C "$scratch/make" CXX=aarch64-linux-gnu-g++
    for program in "$scratch/cmake/storage_consumer" "$scratch/make/storage_consumer"; do
      file -L "$program" | grep -q ', ARM aarch64, ' || { echo "not an ARM64 program: $program" >&2; exit 1; }
      store=$scratch/store-$(basename "$(dirname "$program")")
      tests/consumer/run_consumer.sh "$store" qemu-aarch64 -L /usr/aarch64-linux-gnu "$program"
      echo "ARM64 consumer ran: $program"
    done
    ;;
  *)
    echo "usage: scripts/package.sh [native|arm64|autopkgtest|arm64-consumer]" >&2
    exit 2
    ;;
esac
