#!/usr/bin/env bash
# cmake --install of the build tree into a scratch prefix installs exactly
# the tool, its manual page, the two libraries, their public headers below
# include/migrate_settings/, the CMake package configuration and the
# pkg-config file; tests/consumer then builds against that prefix twice,
# with find_package and with its Makefile through pkg-config, and each
# program runs.
# usage: consumer_test.sh SETTINGS   (a shell file written by CMakeLists.txt)
set -euo pipefail
# build_dir source_dir generator build_type bindir libdir includedir mandir
# cache_settings cxx_compiler cxx_flags linker_flags cross emulator=(...)
source "$1"

scratch=$(mktemp -d /tmp/consumer-test.XXXXXX)
trap 'rm -rf "$scratch"' EXIT
prefix=$scratch/prefix

cmake --install "$build_dir" --prefix "$prefix" >"$scratch/install.log" || {
  cat "$scratch/install.log"
  exit 1
}

package=$libdir/cmake/migrate_settings
{
  printf '%s\n' "$bindir/migrate_settings" "$mandir/man1/migrate_settings.1" \
    "$bindir/inspect_store" "$mandir/man1/inspect_store.1" \
    "$libdir/libmigrate_settings_common.a" "$libdir/libmigrate_settings_storage.a" \
    "$package/migrate_settings-config.cmake" "$package/migrate_settings-config-version.cmake" \
    "$package/migrate_settings-targets.cmake" "$package/migrate_settings-targets-$(tr '[:upper:]' '[:lower:]' <<<"${build_type:-noconfig}").cmake" \
    "$libdir/pkgconfig/migrate_settings.pc"
  # Every header but the private ones: the CRC's choice of implementation
  # and the store's directory helper.
  (cd "$source_dir/libcommon" && find lib/util -name '*.h' ! -name crc32_paths.h) | sed "s|^|$includedir/migrate_settings/|"
  (cd "$source_dir" && find lib/storage -maxdepth 1 -name '*.h' ! -name slot_directories.h ! -name untrusted_tree.h) | sed "s|^|$includedir/migrate_settings/|"
} | sort >"$scratch/expected"
(cd "$prefix" && find . -type f -printf '%P\n' | sort) >"$scratch/installed"
if ! diff -u "$scratch/expected" "$scratch/installed"; then
  echo "installed files differ from the expected ones (- expected, + installed)"
  exit 1
fi

package_args=(-DCMAKE_PREFIX_PATH="$prefix")
# A cross build looks for packages only below the target's sysroot.
[ "$cross" = 1 ] && package_args=(-Dmigrate_settings_DIR="$prefix/$package")
cmake -C "$cache_settings" -G "$generator" -S "$source_dir/tests/consumer" -B "$scratch/build" \
  "${package_args[@]}" >"$scratch/configure.log" 2>&1 || {
  cat "$scratch/configure.log"
  exit 1
}
cmake --build "$scratch/build"

# Only this package's pkg-config directory, as a sysroot build would see it.
mkdir "$scratch/make"
PKG_CONFIG_LIBDIR="$prefix/$libdir/pkgconfig" PKG_CONFIG_PATH= \
  make -s -f "$source_dir/tests/consumer/Makefile" -C "$scratch/make" \
  CXX="$cxx_compiler" CXXFLAGS="$cxx_flags" LDFLAGS="$linker_flags" >"$scratch/make.log" 2>&1 || {
  cat "$scratch/make.log"
  exit 1
}

"$source_dir/tests/consumer/run_consumer.sh" "$scratch/store" "${emulator[@]}" "$scratch/build/storage_consumer"
"$source_dir/tests/consumer/run_consumer.sh" "$scratch/make-store" "${emulator[@]}" "$scratch/make/storage_consumer"
