# End-to-end tests through the development host and real child programs.
find_program(CURL_EXECUTABLE curl REQUIRED)
add_executable(sorvik_update_e2e_tests ${CMAKE_CURRENT_LIST_DIR}/update_e2e_test.cc)
target_compile_definitions(sorvik_update_e2e_tests PRIVATE
  SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>"
  SORVIK_NEXT_PLUGIN_PATH="$<TARGET_FILE:sorvik_next>"
  SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
  SORVIK_SOURCE_DIR="${PROJECT_SOURCE_DIR}"
  SORVIK_VERSION="${SORVIK_VERSION}"
  SORVIK_NEXT_VERSION="${SORVIK_NEXT_VERSION}"
  CURL_PATH="${CURL_EXECUTABLE}")
target_link_libraries(sorvik_update_e2e_tests PRIVATE sorvik_test_support GTest::gtest GTest::gtest_main)
add_dependencies(sorvik_update_e2e_tests sorvik sorvik_next sorvik-host)
gtest_discover_tests(sorvik_update_e2e_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 180)

add_executable(sorvik_silent_agent ${CMAKE_CURRENT_LIST_DIR}/support/silent_agent.cc)
add_executable(sorvik_failover_e2e_tests ${CMAKE_CURRENT_LIST_DIR}/failover_e2e_test.cc)
target_compile_definitions(sorvik_failover_e2e_tests PRIVATE
  SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>"
  SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
  KELP_PATH="$<TARGET_FILE:kelp>"
  SILENT_AGENT_PATH="$<TARGET_FILE:sorvik_silent_agent>"
  SORVIK_SOURCE_DIR="${PROJECT_SOURCE_DIR}")
target_link_libraries(sorvik_failover_e2e_tests PRIVATE sorvik_test_support sorvik_platform GTest::gtest GTest::gtest_main)
add_dependencies(sorvik_failover_e2e_tests sorvik sorvik-host kelp sorvik_silent_agent)
gtest_discover_tests(sorvik_failover_e2e_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 180)
