# Windows-only tests and the Windows side of the shared plug-in test.
if(NOT WIN32)
  return()
endif()

# The entry-point test loads the plug-in through <dlfcn.h>; here that is a
# thin layer over LoadLibrary, and the DLL is found beside the test
# executable as a host finds it beside its own.
sorvik_windows_posix_compat(sorvik_entry_points_tests)
get_target_property(_defs sorvik_entry_points_tests COMPILE_DEFINITIONS)
list(FILTER _defs EXCLUDE REGEX "^SORVIK_PLUGIN_PATH=")
list(APPEND _defs "SORVIK_PLUGIN_PATH=\"sorvik.dll\"")
set_target_properties(sorvik_entry_points_tests PROPERTIES COMPILE_DEFINITIONS "${_defs}")

file(GLOB _windows_tests CONFIGURE_DEPENDS ${CMAKE_CURRENT_LIST_DIR}/windows_*_test.cc)
# The failback session stops every kelp.exe by name: it runs alone.
set(_windows_session_test ${CMAKE_CURRENT_LIST_DIR}/windows_failback_session_test.cc)
list(REMOVE_ITEM _windows_tests ${_windows_session_test})
if(_windows_tests)
  add_executable(sorvik_windows_tests ${_windows_tests})
  target_include_directories(sorvik_windows_tests PRIVATE ${PROJECT_SOURCE_DIR})
  target_link_libraries(sorvik_windows_tests PRIVATE
    sorvik_service sorvik_platform sorvik_fake_host sorvik_host_core tinyxml_pkg GTest::gtest GTest::gtest_main)
  gtest_discover_tests(sorvik_windows_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
endif()

if(EXISTS ${_windows_session_test})
  add_executable(sorvik_windows_session_tests ${_windows_session_test})
  target_include_directories(sorvik_windows_session_tests PRIVATE ${PROJECT_SOURCE_DIR})
  target_link_libraries(sorvik_windows_session_tests PRIVATE
    sorvik_platform sorvik_host_core tinyxml_pkg ws2_32 GTest::gtest GTest::gtest_main)
  add_dependencies(sorvik_windows_session_tests sorvik kelp)
  gtest_discover_tests(sorvik_windows_session_tests DISCOVERY_TIMEOUT 60
    PROPERTIES TIMEOUT 120 RUN_SERIAL TRUE)
endif()

add_executable(sorvik_windows_test_child ${CMAKE_CURRENT_LIST_DIR}/windows_test_child.cc)
foreach(_t sorvik_windows_tests sorvik_windows_session_tests)
  if(TARGET ${_t})
    add_dependencies(${_t} sorvik_windows_test_child sorvik)
    target_compile_definitions(${_t} PRIVATE SORVIK_TEST_CHILD="$<TARGET_FILE_NAME:sorvik_windows_test_child>")
  endif()
endforeach()

# WindowsHostExeTest runs sorvik-host.exe from beside the test executable.
if(TARGET sorvik-host)
  add_dependencies(sorvik_windows_tests sorvik-host)
endif()

# The host's platform-neutral tests (script language, documents, display)
# run against the Windows build of the shared host code too.
if(EXISTS ${CMAKE_CURRENT_LIST_DIR}/host_script_test.cc)
  add_executable(sorvik_host_script_tests ${CMAKE_CURRENT_LIST_DIR}/host_script_test.cc)
  target_include_directories(sorvik_host_script_tests PRIVATE ${PROJECT_SOURCE_DIR})
  target_link_libraries(sorvik_host_script_tests PRIVATE sorvik_host_core tinyxml_pkg GTest::gtest GTest::gtest_main)
  gtest_discover_tests(sorvik_host_script_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
endif()
