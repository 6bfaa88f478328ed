# The in-process stand-in for the host server that tests run the plug-in
# against. No test framework inside: any test or benchmark can link it.
add_library(sorvik_fake_host STATIC ${CMAKE_CURRENT_LIST_DIR}/fake_host.cc)
target_link_libraries(sorvik_fake_host PUBLIC sorvik_ipc sorvik_plugin Threads::Threads)

if(SORVIK_BUILD_TESTS)
  add_executable(sorvik_fake_host_tests ${CMAKE_CURRENT_LIST_DIR}/fake_host_test.cc)
  target_link_libraries(sorvik_fake_host_tests PRIVATE sorvik_fake_host GTest::gtest GTest::gtest_main)
  gtest_discover_tests(sorvik_fake_host_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
endif()
