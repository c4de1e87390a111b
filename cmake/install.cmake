# cmake --install: the tool with its manual page, and the common and storage
# libraries with their public headers and a package configuration, so that
# another program links them with
#   find_package(migrate_settings) and migrate_settings::storage.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(MIGRATE_SETTINGS_PACKAGE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/migrate_settings)

install(TARGETS migrate_settings RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(FILES ${PROJECT_SOURCE_DIR}/docs/migrate_settings.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)

install(TARGETS common storage EXPORT migrate_settings-targets
        ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
# Installed as the sources include them: "lib/util/...", "lib/storage/...".
install(DIRECTORY ${PROJECT_SOURCE_DIR}/libcommon/lib/util/
        DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/lib/util
        FILES_MATCHING PATTERN "*.h")
# The tool's headers are its own.
install(DIRECTORY ${PROJECT_SOURCE_DIR}/lib/storage/
        DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/lib/storage
        FILES_MATCHING PATTERN "*.h"
        PATTERN tools EXCLUDE)

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
