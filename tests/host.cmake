# Tests of the development host, its process runner and the agent kelp.
# They run the real binaries and real child processes.

# A minimal plug-in that spawns children through its own packets.
add_library(sorvik_host_test_plugin MODULE ${CMAKE_CURRENT_LIST_DIR}/host_test_plugin.cc)
target_link_libraries(sorvik_host_test_plugin PRIVATE sorvik_ipc sorvik_plugin sorvik_platform)

add_executable(sorvik_host_tests
  ${CMAKE_CURRENT_LIST_DIR}/host_process_runner_test.cc
  ${CMAKE_CURRENT_LIST_DIR}/host_script_test.cc
  ${CMAKE_CURRENT_LIST_DIR}/host_kelp_test.cc
  ${CMAKE_CURRENT_LIST_DIR}/host_end_to_end_test.cc)
target_compile_definitions(sorvik_host_tests PRIVATE
  SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
  KELP_PATH="$<TARGET_FILE:kelp>"
  HOST_TEST_PLUGIN_PATH="$<TARGET_FILE:sorvik_host_test_plugin>")
target_link_libraries(sorvik_host_tests PRIVATE sorvik_host_core sorvik_kelp_core sorvik_test_support
  GTest::gtest GTest::gtest_main)
add_dependencies(sorvik_host_tests sorvik-host kelp sorvik_host_test_plugin)
gtest_discover_tests(sorvik_host_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)

# The real plug-in under the host, in its own binary so that the other host
# tests do not depend on the plug-in building.
add_executable(sorvik_host_plugin_restart_tests ${CMAKE_CURRENT_LIST_DIR}/host_plugin_restart_test.cc)
target_compile_definitions(sorvik_host_plugin_restart_tests PRIVATE
  SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
  KELP_PATH="$<TARGET_FILE:kelp>"
  SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>")
target_link_libraries(sorvik_host_plugin_restart_tests PRIVATE sorvik_test_support GTest::gtest GTest::gtest_main)
add_dependencies(sorvik_host_plugin_restart_tests sorvik-host kelp sorvik)
gtest_discover_tests(sorvik_host_plugin_restart_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
