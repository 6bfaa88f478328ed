# End-to-end tests through the development host and real child programs.
find_program(CURL_EXECUTABLE curl REQUIRED)
add_executable(sorvik_silent_agent ${CMAKE_CURRENT_LIST_DIR}/support/silent_agent.cc)

# sorvik_e2e_test(NAME SOURCE): a test binary that knows
# where the built plug-in, its next version, the host, the agents and curl are.
function(sorvik_e2e_test name source)
  add_executable(${name} ${CMAKE_CURRENT_LIST_DIR}/${source})
  target_compile_definitions(${name} PRIVATE
    SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>"
    SORVIK_NEXT_PLUGIN_PATH="$<TARGET_FILE:sorvik_next>"
    SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
    KELP_PATH="$<TARGET_FILE:kelp>"
    SILENT_AGENT_PATH="$<TARGET_FILE:sorvik_silent_agent>"
    SORVIK_SOURCE_DIR="${PROJECT_SOURCE_DIR}"
    SORVIK_VERSION="${SORVIK_VERSION}"
    SORVIK_NEXT_VERSION="${SORVIK_NEXT_VERSION}"
    CURL_PATH="${CURL_EXECUTABLE}")
  target_link_libraries(${name} PRIVATE sorvik_test_support sorvik_platform GTest::gtest GTest::gtest_main)
  add_dependencies(${name} sorvik sorvik_next sorvik-host kelp sorvik_silent_agent)
  gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 180)
endfunction()

sorvik_e2e_test(sorvik_update_e2e_tests update_e2e_test.cc)
sorvik_e2e_test(sorvik_failover_e2e_tests failover_e2e_test.cc)
