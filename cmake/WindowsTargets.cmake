# The Windows build's share of host/ and tests/: the folder libraries and
# their tests come from Sorvik/ as on Linux; of host/ and tests/ only the
# parts that run on Windows are taken. The POSIX development host, its
# runner and their tests, the dlopen loader and the benchmarks stay Linux
# only.

# The plug-in is "sorvik.dll" and exports the six entry points and nothing
# else (the .def file also keeps the static runtime's symbols out).
foreach(_plugin sorvik sorvik_next)
  if(TARGET ${_plugin})
    set_target_properties(${_plugin} PROPERTIES PREFIX "" IMPORT_PREFIX "")
    target_sources(${_plugin} PRIVATE ${PROJECT_SOURCE_DIR}/Sorvik/platform/windows/sorvik.def)
    target_link_options(${_plugin} PRIVATE -Wl,--exclude-all-symbols -Wl,--no-undefined)
  endif()
endforeach()
# A DLL is a runtime artifact on Windows; the next version keeps its own
# directory as on Linux.
if(TARGET sorvik_next)
  set_target_properties(sorvik_next PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/next
    ARCHIVE_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/next)
endif()

# Shared tests and tools use a few POSIX calls (dlopen, setenv, mkdtemp,
# strptime, timegm, lstat); they get small Win32 versions of them.
set(SORVIK_POSIX_COMPAT_DIR ${PROJECT_SOURCE_DIR}/Sorvik/platform/windows/posix_compat)
add_library(sorvik_posix_compat STATIC
  ${SORVIK_POSIX_COMPAT_DIR}/dlfcn.cc ${SORVIK_POSIX_COMPAT_DIR}/unistd.cc ${SORVIK_POSIX_COMPAT_DIR}/time.cc
  ${SORVIK_POSIX_COMPAT_DIR}/stat.cc)
target_include_directories(sorvik_posix_compat BEFORE PUBLIC ${SORVIK_POSIX_COMPAT_DIR})
function(sorvik_windows_posix_compat target)
  target_link_libraries(${target} PRIVATE sorvik_posix_compat)
endfunction()
foreach(_folder platform plugin ipc service update failover)
  if(TARGET sorvik_${_folder}_tests)
    sorvik_windows_posix_compat(sorvik_${_folder}_tests)
  endif()
endforeach()

include(${PROJECT_SOURCE_DIR}/host/fake_host.cmake)
foreach(_part windows)
  if(EXISTS ${PROJECT_SOURCE_DIR}/host/${_part}.cmake)
    include(${PROJECT_SOURCE_DIR}/host/${_part}.cmake)
  endif()
endforeach()

if(SORVIK_BUILD_TESTS)
  include(${PROJECT_SOURCE_DIR}/tests/plugin.cmake)
  include(${PROJECT_SOURCE_DIR}/tests/windows.cmake)

  # Shared test cases whose expectations are POSIX facts; the Windows
  # behaviour they touch is covered by sorvik_windows_tests.
  set(_posix_only_cases
    # nm on a shared object; sorvik_dll_exports checks the DLL.
    ExportsTest.ExactlyTheSixEntryPointsAreExported
    # need a symbolic link that Boost resolves; Wine's links are not
    # reparse points, and Windows needs a privilege to make one.
    DownloadDirTest.ProtectsRootsTheCurrentDirectoryAndItsAncestors)
  list(JOIN _posix_only_cases "\n  " _ignored)
  file(WRITE ${CMAKE_BINARY_DIR}/CTestCustom.cmake
    "# Written by cmake/WindowsTargets.cmake\nset(CTEST_CUSTOM_TESTS_IGNORE\n  ${_ignored})\n")

  # Checked on the build machine with the cross binutils, not under Wine.
  add_test(NAME sorvik_dll_exports
    COMMAND ${CMAKE_COMMAND} -DDLL=$<TARGET_FILE:sorvik> -DOBJDUMP=${CMAKE_OBJDUMP}
            -P ${PROJECT_SOURCE_DIR}/cmake/WindowsCheckDll.cmake)
endif()

# The Windows package, staged in package/: the plug-in, the sample scripts,
# the reference agent and the development host. Debug information stays
# in the build tree's copies.
set(_package ${CMAKE_BINARY_DIR}/package)
set(_package_steps
  COMMAND ${CMAKE_COMMAND} -E rm -rf ${_package}
  COMMAND ${CMAKE_COMMAND} -E make_directory ${_package}/scripts
  # PowerShell samples; scripts/ holds the POSIX host's /bin/sh stand-ins.
  COMMAND ${CMAKE_COMMAND} -E copy_directory ${PROJECT_SOURCE_DIR}/tools/windows-scripts ${_package}/scripts)
set(_package_deps sorvik)
foreach(_program sorvik kelp sorvik-host)
  if(TARGET ${_program})
    list(APPEND _package_deps ${_program})
    list(APPEND _package_steps
      COMMAND ${CMAKE_COMMAND} -E copy $<TARGET_FILE:${_program}> ${_package}/
      COMMAND ${CMAKE_STRIP} --strip-debug ${_package}/$<TARGET_FILE_NAME:${_program}>)
  endif()
endforeach()
add_custom_target(windows_package ALL ${_package_steps} DEPENDS ${_package_deps} VERBATIM)
