# cmake --install: the tool and inspect_store with their manual pages, and
# the common and storage libraries with their public headers, a CMake
# package configuration and a pkg-config file, so that another program
# links them with
#   find_package(migrate_settings) and migrate_settings::storage, or
#   pkg-config --cflags --libs migrate_settings.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(MIGRATE_SETTINGS_PACKAGE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/migrate_settings)

install(TARGETS migrate_settings inspect_store RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(FILES ${PROJECT_SOURCE_DIR}/docs/migrate_settings.1 ${PROJECT_SOURCE_DIR}/docs/inspect_store.1
        DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)

install(TARGETS common storage EXPORT migrate_settings-targets
        ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
# Headers go below a directory of the package's own, so that global names
# such as Status and crc32 never land in a shared sysroot's include
# directory; inside it they keep the paths the sources include them by:
# "lib/util/...", "lib/storage/...".
install(DIRECTORY ${PROJECT_SOURCE_DIR}/libcommon/lib/util/
        DESTINATION ${MIGRATE_SETTINGS_INCLUDE_DIR}/lib/util
        FILES_MATCHING PATTERN "*.h"
        PATTERN crc32_paths.h EXCLUDE)  # which CRC code runs is the library's affair
# The tool's headers are its own; how the dual-file store reaches its files
# (slot_directories.h, untrusted_tree.h) serves the library's sources only.
install(DIRECTORY ${PROJECT_SOURCE_DIR}/lib/storage/
        DESTINATION ${MIGRATE_SETTINGS_INCLUDE_DIR}/lib/storage
        FILES_MATCHING PATTERN "*.h"
        PATTERN tools EXCLUDE
        PATTERN slot_directories.h EXCLUDE
        PATTERN untrusted_tree.h EXCLUDE)

# pkg-config, for Makefile and Autotools builds. The prefix is the one
# installed to (cmake --install --prefix), known only at install time.
set(MIGRATE_SETTINGS_PC_PREFIX "@CMAKE_INSTALL_PREFIX@")
configure_file(${CMAKE_CURRENT_LIST_DIR}/migrate_settings.pc.in ${PROJECT_BINARY_DIR}/migrate_settings.pc.in @ONLY)
install(CODE "configure_file(\"${PROJECT_BINARY_DIR}/migrate_settings.pc.in\" \"${PROJECT_BINARY_DIR}/migrate_settings.pc\" @ONLY)")
install(FILES ${PROJECT_BINARY_DIR}/migrate_settings.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

install(EXPORT migrate_settings-targets
        NAMESPACE migrate_settings::
        DESTINATION ${MIGRATE_SETTINGS_PACKAGE_DIR})
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/migrate_settings-config.cmake.in
                              ${PROJECT_BINARY_DIR}/migrate_settings-config.cmake
                              INSTALL_DESTINATION ${MIGRATE_SETTINGS_PACKAGE_DIR})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/migrate_settings-config-version.cmake
                                 COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/migrate_settings-config.cmake
              ${PROJECT_BINARY_DIR}/migrate_settings-config-version.cmake
        DESTINATION ${MIGRATE_SETTINGS_PACKAGE_DIR})
