# Debian's libgtest-dev holds libraries for the build machine only, unless
# the target's own (libgtest-dev:arm64) is installed, as a package build
# for the target has it. Otherwise a cross build compiles GoogleTest from
# the sources that Debian ships with it (package googletest) and answers
# the tests' find_package(GTest) with them.
if(NOT CMAKE_CROSSCOMPILING)
  return()
endif()
find_package(GTest QUIET)
if(GTest_FOUND)
  return()
endif()

set(MIGRATE_SETTINGS_GTEST_SOURCE_DIR /usr/src/googletest
    CACHE PATH "GoogleTest sources to build for the target")
if(NOT EXISTS ${MIGRATE_SETTINGS_GTEST_SOURCE_DIR}/CMakeLists.txt)
  message(FATAL_ERROR "No GoogleTest sources in ${MIGRATE_SETTINGS_GTEST_SOURCE_DIR} "
                      "(Debian package googletest)")
endif()

set(BUILD_GMOCK OFF CACHE BOOL "" FORCE)
set(INSTALL_GTEST OFF CACHE BOOL "" FORCE)
add_subdirectory(${MIGRATE_SETTINGS_GTEST_SOURCE_DIR} ${CMAKE_BINARY_DIR}/googletest EXCLUDE_FROM_ALL SYSTEM)

# GoogleTest's own build names its targets GTest::gtest and GTest::gtest_main.
foreach(target gtest gtest_main)
  if(NOT TARGET GTest::${target})
    add_library(GTest::${target} ALIAS ${target})
  endif()
endforeach()
file(WRITE ${CMAKE_FIND_PACKAGE_REDIRECTS_DIR}/gtest-config.cmake
     "# GoogleTest is built in this tree: ${MIGRATE_SETTINGS_GTEST_SOURCE_DIR}\n")
