#!/usr/bin/env bash
# Configures, builds and installs the sources the way a distribution's
# build does, with its configure line, flags and install step, then builds
# tests/consumer against what was installed (find_package and pkg-config)
# and runs it and the installed tool.
#   debian     debhelper's cmake line: CMAKE_BUILD_TYPE=None with
#              dpkg-buildflags' hardened flags, a multiarch libdir, static
#              libraries, make install with DESTDIR
#   yocto      cmake.bbclass: Ninja, relative install directories, the
#              recipe's BUILD_SHARED_LIBS=ON with its ptest (the tests on,
#              only the tools and the ptest's tests built), the install
#              target with DESTDIR; then the recipe's do_install_ptest and
#              its run-ptest, which must print PASS: lines and no FAIL:
#   buildroot  cmake-package: Release, BUILD_SHARED_LIBS=ON, its BUILD_*=OFF
#              switches, make install/fast with DESTDIR into the staging
#              and the target directory
# Every configure runs without a network when the kernel lets this process
# make a namespace of its own.
# usage: packager_builds_test.sh SOURCE_DIR debian|yocto|buildroot
set -euo pipefail
source_dir=$1
way=$2

scratch=$(mktemp -d "/tmp/packager-$way.XXXXXX")
trap 'rm -rf "$scratch"' EXIT
build=$scratch/build
dest=$scratch/dest
jobs=-j2

offline=()
unshare --net true 2>/dev/null && offline=(unshare --net)

# run LOG COMMAND...: the command's output only when it fails.
run() {
  local log=$scratch/$1
  shift
  "$@" >"$log" 2>&1 || {
    echo "failed: $*"
    cat "$log"
    return 1
  }
}

shared=0
ptest_run=0
case $way in
  debian)
    libdir=lib/$(dpkg-architecture -qDEB_HOST_MULTIARCH)
    eval "$(DEB_BUILD_MAINT_OPTIONS=hardening=+all dpkg-buildflags --export=sh)"
    export CXXFLAGS="$CXXFLAGS $CPPFLAGS" CFLAGS="$CFLAGS $CPPFLAGS"
    run configure.log "${offline[@]}" cmake -S "$source_dir" -B "$build" -G "Unix Makefiles" \
      -DCMAKE_INSTALL_PREFIX=/usr -DCMAKE_BUILD_TYPE=None -DCMAKE_INSTALL_SYSCONFDIR=/etc \
      -DCMAKE_INSTALL_LOCALSTATEDIR=/var -DCMAKE_EXPORT_NO_PACKAGE_REGISTRY=ON \
      -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF -DCMAKE_FIND_PACKAGE_NO_PACKAGE_REGISTRY=ON \
      -DFETCHCONTENT_FULLY_DISCONNECTED=ON -DCMAKE_INSTALL_RUNSTATEDIR=/run \
      -DCMAKE_SKIP_INSTALL_ALL_DEPENDENCY=ON -DCMAKE_VERBOSE_MAKEFILE=ON \
      -DCMAKE_INSTALL_LIBDIR="$libdir" -DBUILD_TESTING=OFF
    run build.log make -C "$build" "$jobs"
    run install.log make -C "$build" install DESTDIR="$dest"
    # The distribution's flags reached the compiler and the linker.
    grep -q -e '-D_FORTIFY_SOURCE=2 .*-c .*/storage_target\.cpp' "$scratch/build.log" ||
      { echo "the hardening flags did not reach the compiler"; exit 1; }
    readelf -d "$dest/usr/bin/migrate_settings" | grep -q 'BIND_NOW' ||
      { echo "the hardening flags did not reach the linker (no BIND_NOW)"; exit 1; }
    ;;
  yocto)
    libdir=lib
    # What the layer's toolchain file and the recipe put in the cache, with
    # the debug prefix maps of its package's debug sources.
    cat >"$scratch/toolchain-cache.cmake" <<'EOF'
set(CMAKE_CXX_FLAGS "-O2 -pipe -g -feliminate-unused-debug-types -fmacro-prefix-map=@S@=/usr/src/debug/migrate-settings/0.1.0-r0 -fdebug-prefix-map=@S@=/usr/src/debug/migrate-settings/0.1.0-r0" CACHE STRING "")
set(CMAKE_C_FLAGS "-O2 -pipe -g -feliminate-unused-debug-types -fmacro-prefix-map=@S@=/usr/src/debug/migrate-settings/0.1.0-r0" CACHE STRING "")
set(CMAKE_CXX_FLAGS_RELEASE "-DNDEBUG" CACHE STRING "")
set(CMAKE_C_FLAGS_RELEASE "-DNDEBUG" CACHE STRING "")
set(CMAKE_EXE_LINKER_FLAGS "-Wl,-O1 -Wl,--hash-style=gnu -Wl,--as-needed" CACHE STRING "")
set(CMAKE_SHARED_LINKER_FLAGS "-Wl,-O1 -Wl,--hash-style=gnu -Wl,--as-needed" CACHE STRING "")
EOF
    sed -i "s|@S@|$source_dir|g" "$scratch/toolchain-cache.cmake"
    run configure.log "${offline[@]}" cmake -G Ninja -C "$scratch/toolchain-cache.cmake" -S "$source_dir" -B "$build" \
      -DCMAKE_INSTALL_PREFIX:PATH=/usr -DCMAKE_INSTALL_BINDIR:PATH=bin -DCMAKE_INSTALL_SBINDIR:PATH=sbin \
      -DCMAKE_INSTALL_LIBEXECDIR:PATH=libexec -DCMAKE_INSTALL_SYSCONFDIR:PATH=/etc \
      -DCMAKE_INSTALL_SHAREDSTATEDIR:PATH=../com -DCMAKE_INSTALL_LOCALSTATEDIR:PATH=/var \
      -DCMAKE_INSTALL_LIBDIR:PATH=lib -DCMAKE_INSTALL_INCLUDEDIR:PATH=include \
      -DCMAKE_INSTALL_DATAROOTDIR:PATH=share -DCMAKE_INSTALL_SO_NO_EXE=0 -DCMAKE_NO_SYSTEM_FROM_IMPORTED=1 \
      -DCMAKE_EXPORT_NO_PACKAGE_REGISTRY=ON -DFETCHCONTENT_FULLY_DISCONNECTED=ON -DCMAKE_BUILD_TYPE=Release \
      -DBUILD_SHARED_LIBS=ON -DBUILD_TESTING=ON -DCMAKE_SKIP_INSTALL_ALL_DEPENDENCY=ON -Wno-dev
    ptest_tests=(common_tests tool_tests)
    run build.log cmake --build "$build" "$jobs" --target migrate_settings inspect_store "${ptest_tests[@]}"
    DESTDIR=$dest run install.log cmake --build "$build" --target install
    shared=1
    ptest_run=1
    ;;
  buildroot)
    run configure.log "${offline[@]}" cmake -S "$source_dir" -B "$build" -G "Unix Makefiles" \
      -DCMAKE_BUILD_TYPE=Release -DCMAKE_INSTALL_PREFIX=/usr -DCMAKE_COLOR_MAKEFILE=OFF \
      -DBUILD_DOC=OFF -DBUILD_DOCS=OFF -DBUILD_EXAMPLE=OFF -DBUILD_EXAMPLES=OFF -DBUILD_TEST=OFF \
      -DBUILD_TESTS=OFF -DBUILD_TESTING=OFF -DBUILD_SHARED_LIBS=ON
    # GNUInstallDirs' choice: lib/<multiarch> on a Debian build machine,
    # lib with Buildroot's toolchain file.
    libdir=$(sed -n 's/^CMAKE_INSTALL_LIBDIR:PATH=//p' "$build/CMakeCache.txt")
    run build.log make -C "$build" "$jobs"
    # install/fast installs without checking the build again, once into
    # the staging directory (headers, libraries) and once into the target.
    run install.log make -C "$build" DESTDIR="$dest" install/fast
    run install-target.log make -C "$build" DESTDIR="$scratch/target" install/fast
    cmp "$dest/usr/bin/migrate_settings" "$scratch/target/usr/bin/migrate_settings"
    shared=1
    ;;
  *)
    echo "usage: packager_builds_test.sh SOURCE_DIR debian|yocto|buildroot" >&2
    exit 2
    ;;
esac

# The distribution's flags (fortified, hardened) find nothing to warn about.
if grep 'warning:' "$scratch/build.log"; then
  echo "the build warns (above)"
  exit 1
fi

# Exactly the package's files, below /usr.
usr=$dest/usr
package=$libdir/cmake/migrate_settings
build_type=$(sed -n 's/^CMAKE_BUILD_TYPE:STRING=//p' "$build/CMakeCache.txt")
{
  printf '%s\n' bin/migrate_settings bin/inspect_store share/man/man1/migrate_settings.1 \
    share/man/man1/inspect_store.1 "$package/migrate_settings-config.cmake" \
    "$package/migrate_settings-config-version.cmake" "$package/migrate_settings-targets.cmake" \
    "$package/migrate_settings-targets-${build_type,,}.cmake" "$libdir/pkgconfig/migrate_settings.pc"
  for library in common storage; do
    if [ "$shared" = 1 ]; then
      printf '%s\n' "$libdir/libmigrate_settings_$library.so" "$libdir/libmigrate_settings_$library.so.0.1" \
        "$libdir/libmigrate_settings_$library.so.0.1.0"
    else
      echo "$libdir/libmigrate_settings_$library.a"
    fi
  done
  (cd "$source_dir/libcommon" && find lib/util -name '*.h' ! -name crc32_paths.h) | sed 's|^|include/migrate_settings/|'
  (cd "$source_dir" && find lib/storage -maxdepth 1 -name '*.h' ! -name slot_directories.h ! -name untrusted_tree.h) |
    sed 's|^|include/migrate_settings/|'
} | sort >"$scratch/expected"
(cd "$usr" && find . ! -type d -printf '%P\n' | sort) >"$scratch/installed"
diff -u "$scratch/expected" "$scratch/installed" ||
  { echo "installed files differ from the expected ones (- expected, + installed)"; exit 1; }
grep -qx 'prefix=/usr' "$usr/$libdir/pkgconfig/migrate_settings.pc" ||
  { echo "the pkg-config file does not name the configured prefix"; exit 1; }

runtime=()
if [ "$shared" = 1 ]; then
  # Versioned sonames, and the tool uses the shared library.
  for library in common storage; do
    readelf -d "$usr/$libdir/libmigrate_settings_$library.so.0.1.0" |
      grep -q "Library soname: \[libmigrate_settings_$library.so.0.1\]" ||
      { echo "libmigrate_settings_$library has no soname libmigrate_settings_$library.so.0.1"; exit 1; }
  done
  readelf -d "$usr/bin/migrate_settings" | grep -q 'NEEDED.*\[libmigrate_settings_storage.so.0.1\]' ||
    { echo "migrate_settings does not use the shared storage library"; exit 1; }
  runtime=(env LD_LIBRARY_PATH="$usr/$libdir")
fi
"${runtime[@]}" "$usr/bin/migrate_settings" --help >"$scratch/help.out" 2>&1 || { echo "the installed tool does not run:"; cat "$scratch/help.out"; exit 1; }
grep -q "^Usage: " "$scratch/help.out" || { echo "the installed tool prints no usage:"; cat "$scratch/help.out"; exit 1; }
# Its log lines name their sources as every build does, whatever prefix
# maps the distribution's flags carry (here: where no eMMC is found).
"${runtime[@]}" "$usr/bin/migrate_settings" --base "$scratch/base" --target settings --query-present \
  >"$scratch/query.out" 2>/dev/null || true
if grep -v '^lib/storage/storage_target:[0-9]* ' "$scratch/query.out" | grep 'storage_target:'; then
  echo "the installed tool names its source differently (above)"
  exit 1
fi

# The consumer, against the installed tree as a sysroot would hold it.
run consumer-configure.log cmake -S "$source_dir/tests/consumer" -B "$scratch/consumer" -DCMAKE_PREFIX_PATH="$usr"
run consumer-build.log cmake --build "$scratch/consumer"
mkdir "$scratch/make"
PKG_CONFIG_LIBDIR=$usr/$libdir/pkgconfig PKG_CONFIG_SYSROOT_DIR=$dest PKG_CONFIG_PATH='' \
  run consumer-make.log make -f "$source_dir/tests/consumer/Makefile" -C "$scratch/make"
for program in "$scratch/consumer/storage_consumer" "$scratch/make/storage_consumer"; do
  if [ "$shared" = 1 ]; then
    readelf -d "$program" | grep -q 'NEEDED.*\[libmigrate_settings_storage.so.0.1\]' ||
      { echo "$program does not use the shared storage library"; exit 1; }
  fi
  "$source_dir/tests/consumer/run_consumer.sh" "$scratch/store-$(basename "$(dirname "$program")")" \
    "${runtime[@]}" "$program"
done
if [ "$ptest_run" = 1 ]; then
  # do_install_ptest of the recipe, into the usual directory, and run-ptest.
  ptest=$scratch/ptest/usr/lib/migrate-settings/ptest
  mkdir -p "$ptest/source"
  for test in "${ptest_tests[@]}"; do
    install -m 0755 "$(find "$build/tests" -name "$test" -type f)" "$ptest/"
  done
  recipe_files=$source_dir/packaging/yocto/recipes-support/migrate-settings/files
  install -m 0755 "$recipe_files/run-ptest" "$ptest/"
  (cd "$source_dir" && find libcommon lib -name '*.cpp' -o -name '*.h' | tar -cf - -T -) | tar -xf - -C "$ptest/source"
  status=0
  "${runtime[@]}" "$ptest/run-ptest" >"$scratch/ptest.log" 2>&1 || status=$?
  passed=$(grep -c '^PASS: ' "$scratch/ptest.log" || true)
  if [ "$status" != 0 ] || grep '^FAIL: ' "$scratch/ptest.log" || [ "$passed" -lt 100 ]; then
    echo "run-ptest: status $status, $passed PASS: lines"
    cat "$scratch/ptest.log"
    exit 1
  fi
  # A failing case, and a test program that crashes, are reported.
  printf '%s\n' '#!/bin/sh' 'echo "[       OK ] Good.Case (0 ms)"' 'echo "[  FAILED  ] Bad.Case/1, where GetParam() = 2 (1 ms)"' \
    'echo "[  PASSED  ] 1 test."' 'echo "[  FAILED  ] Bad.Case/1, where GetParam() = 2"' 'exit 1' >"$scratch/broken_tests"
  printf '%s\n' '#!/bin/sh' 'echo "[ RUN      ] Crash.Case"' 'kill -SEGV $$' >"$scratch/crashing_tests"
  mkdir "$scratch/broken-ptest"
  install -m 0755 "$recipe_files/run-ptest" "$scratch/broken_tests" "$scratch/crashing_tests" "$scratch/broken-ptest/"
  status=0
  "$scratch/broken-ptest/run-ptest" >"$scratch/broken-ptest.log" 2>&1 || status=$?
  printf '%s\n' 'PASS: Good.Case' 'FAIL: Bad.Case/1' 'FAIL: broken_tests' 'FAIL: crashing_tests' >"$scratch/broken-expected"
  if [ "$status" != 1 ] || ! diff -u "$scratch/broken-expected" "$scratch/broken-ptest.log"; then
    echo "run-ptest did not report the failures (status $status)"
    exit 1
  fi
  echo "run-ptest: $passed PASS: lines, no FAIL:"
fi
echo "$way: installed $(wc -l <"$scratch/installed") files; the consumer built both ways and ran"
