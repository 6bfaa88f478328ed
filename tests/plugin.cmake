add_executable(sorvik_entry_points_tests ${CMAKE_CURRENT_LIST_DIR}/entry_points_test.cc)
target_include_directories(sorvik_entry_points_tests PRIVATE ${PROJECT_SOURCE_DIR})
target_compile_definitions(sorvik_entry_points_tests PRIVATE
  SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>" SORVIK_VERSION="${SORVIK_VERSION}")
target_link_libraries(sorvik_entry_points_tests PRIVATE sorvik_fake_host GTest::gtest GTest::gtest_main ${CMAKE_DL_LIBS})
add_dependencies(sorvik_entry_points_tests sorvik)
gtest_discover_tests(sorvik_entry_points_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
