# Dependencies of the Windows build. Debian ships no MinGW builds of
# TinyXML, mbed TLS or Boost, so they are compiled here from Debian's own
# source packages, which tools/fetch-windows-sources.sh puts in a cache
# outside the repository. GoogleTest comes from /usr/src/googletest. The
# targets carry the names the rest of the build links against.

set(SORVIK_WINDOWS_SOURCES "$ENV{HOME}/.cache/sorvik-windows/src" CACHE PATH
  "Unpacked Debian sources of TinyXML, mbed TLS and Boost (tools/fetch-windows-sources.sh)")
set(SORVIK_GOOGLETEST_SOURCES "/usr/src/googletest" CACHE PATH "GoogleTest sources")

foreach(_need tinyxml/tinyxml.cpp mbedtls/library/md5.c boost/include/boost/version.hpp
              boost/filesystem-src/operations.cpp)
  if(NOT EXISTS "${SORVIK_WINDOWS_SOURCES}/${_need}")
    message(FATAL_ERROR "${SORVIK_WINDOWS_SOURCES}/${_need} is missing; run tools/fetch-windows-sources.sh")
  endif()
endforeach()

if(SORVIK_BUILD_BENCH OR SORVIK_BUILD_FUZZ)
  message(STATUS "Benchmarks and fuzzers are not part of the Windows build")
  set(SORVIK_BUILD_BENCH OFF CACHE BOOL "" FORCE)
  set(SORVIK_BUILD_FUZZ OFF CACHE BOOL "" FORCE)
endif()

# The C99 printf family (%zu, %lld) instead of the old Microsoft runtime's.
add_compile_definitions(__USE_MINGW_ANSI_STDIO=1)
# MinGW's GCC checks format(printf) attributes against the Microsoft
# dialect, which lacks %zu; the Linux builds check the same format strings.
add_compile_options(-Wno-format)

# One self-contained DLL and self-contained executables: no MinGW runtime
# DLLs to ship beside them.
add_link_options(-static -static-libgcc -static-libstdc++)
# The DLL, the tools and the tests side by side, as in the package: Windows
# finds a DLL in the directory of the program that loads it.
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
# Wine runs the test executables; discovering their tests at build time
# would put Wine into every build.
set(CMAKE_GTEST_DISCOVER_TESTS_DISCOVERY_MODE PRE_TEST)

# Folder tests that need POSIX processes, signals or /bin/sh.
set(SORVIK_SKIPPED_TEST_FILES
  Sorvik/update/update_script_test.cc)

set(_src ${SORVIK_WINDOWS_SOURCES})

add_library(sorvik_dep_tinyxml STATIC
  ${_src}/tinyxml/tinyxml.cpp ${_src}/tinyxml/tinystr.cpp
  ${_src}/tinyxml/tinyxmlerror.cpp ${_src}/tinyxml/tinyxmlparser.cpp)
target_compile_definitions(sorvik_dep_tinyxml PUBLIC TIXML_USE_STL)
target_include_directories(sorvik_dep_tinyxml SYSTEM PUBLIC ${_src}/tinyxml)
target_compile_options(sorvik_dep_tinyxml PRIVATE -w)
add_library(tinyxml_pkg INTERFACE)
target_link_libraries(tinyxml_pkg INTERFACE sorvik_dep_tinyxml)

# Only MD5 is used.
add_library(sorvik_dep_mbedcrypto STATIC
  ${_src}/mbedtls/library/md5.c ${_src}/mbedtls/library/platform_util.c)
target_include_directories(sorvik_dep_mbedcrypto SYSTEM PUBLIC ${_src}/mbedtls/include)
target_compile_options(sorvik_dep_mbedcrypto PRIVATE -w)
add_library(mbedcrypto_pkg INTERFACE)
target_link_libraries(mbedcrypto_pkg INTERFACE sorvik_dep_mbedcrypto)

add_library(sorvik_dep_boost_headers INTERFACE)
target_include_directories(sorvik_dep_boost_headers SYSTEM INTERFACE ${_src}/boost/include)
target_compile_definitions(sorvik_dep_boost_headers INTERFACE BOOST_ALL_NO_LIB)
add_library(Boost::boost ALIAS sorvik_dep_boost_headers)
add_library(Boost::headers ALIAS sorvik_dep_boost_headers)
# Boost.System is header-only since 1.69.
add_library(Boost::system ALIAS sorvik_dep_boost_headers)

file(GLOB _boost_fs_sources ${_src}/boost/filesystem-src/*.cpp)
add_library(sorvik_dep_boost_filesystem STATIC ${_boost_fs_sources})
target_compile_definitions(sorvik_dep_boost_filesystem
  PRIVATE BOOST_FILESYSTEM_SOURCE BOOST_FILESYSTEM_HAS_BCRYPT
  PUBLIC BOOST_FILESYSTEM_STATIC_LINK=1)
target_compile_options(sorvik_dep_boost_filesystem PRIVATE -w)
target_link_libraries(sorvik_dep_boost_filesystem PUBLIC sorvik_dep_boost_headers bcrypt)
add_library(Boost::filesystem ALIAS sorvik_dep_boost_filesystem)

if(SORVIK_BUILD_TESTS)
  set(INSTALL_GTEST OFF CACHE BOOL "" FORCE)
  add_subdirectory(${SORVIK_GOOGLETEST_SOURCES} ${CMAKE_BINARY_DIR}/googletest EXCLUDE_FROM_ALL)
  foreach(_t gtest gtest_main gmock gmock_main)
    target_compile_options(${_t} PRIVATE -w)
  endforeach()
endif()
