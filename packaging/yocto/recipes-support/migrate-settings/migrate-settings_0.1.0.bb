SUMMARY = "Carries settings blobs into the crash-safe stores of the device"
DESCRIPTION = "migrate_settings writes a settings blob into one slot of a \
named store and reports through its exit status; inspect_store shows what \
the stores hold. The storage library, its headers, CMake package and \
pkg-config file are in ${PN}-dev and ${PN}-staticdev."
SECTION = "admin"
# No licence has been granted for this work yet.
LICENSE = "CLOSED"

# Built from the checkout that holds this layer (conf/layer.conf).
inherit externalsrc
EXTERNALSRC = "${MIGRATE_SETTINGS_SOURCE}"
EXTERNALSRC_BUILD = "${WORKDIR}/build"

inherit cmake pkgconfig ptest

# The tests, and GoogleTest, only for the ptest package: its unit tests of
# the common library and of the tool's checks and registry.
DEPENDS += "${@bb.utils.contains('PTEST_ENABLED', '1', 'googletest', '', d)}"
EXTRA_OECMAKE = "-DBUILD_SHARED_LIBS=ON \
                 -DBUILD_TESTING=${@bb.utils.contains('PTEST_ENABLED', '1', 'ON', 'OFF', d)} \
                 -DCMAKE_SKIP_INSTALL_ALL_DEPENDENCY=ON"
PTEST_TESTS = "common_tests tool_tests"
OECMAKE_TARGET_COMPILE = "migrate_settings inspect_store ${@bb.utils.contains('PTEST_ENABLED', '1', '${PTEST_TESTS}', '', d)}"

do_install_ptest() {
    install -d ${D}${PTEST_PATH}/source
    for test in ${PTEST_TESTS}; do
        install -m 0755 $(find ${B}/tests -name $test -type f) ${D}${PTEST_PATH}/
    done
    install -m 0755 ${S}/packaging/yocto/recipes-support/migrate-settings/files/run-ptest ${D}${PTEST_PATH}/
    # Some cases find the line of a log statement in the library's sources.
    (cd ${S} && find libcommon lib -name '*.cpp' -o -name '*.h' | tar -cf - -T -) | \
        tar -xf - -C ${D}${PTEST_PATH}/source
}

# The tool runs /usr/sbin/sfdisk to locate the boot vector and mount to
# remount the boot and resource partitions.
RDEPENDS:${PN} += "util-linux-sfdisk util-linux-mount"
