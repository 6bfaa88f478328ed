# Crash-consistency test of the state file: a child process saving in a loop
# is killed hundreds of times; every load afterwards must give a whole document.
add_executable(sorvik_state_file_crash_tests ${CMAKE_CURRENT_LIST_DIR}/state_file_crash_test.cc)
target_link_libraries(sorvik_state_file_crash_tests PRIVATE sorvik_service GTest::gtest GTest::gtest_main)
gtest_discover_tests(sorvik_state_file_crash_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
