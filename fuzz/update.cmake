# libFuzzer target for the bundle location grammar. The parser is compiled
# into the target itself so that libFuzzer sees its coverage.
if(NOT CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  message(STATUS "location_fuzz needs Clang; skipped")
  return()
endif()

add_executable(location_fuzz
  ${CMAKE_CURRENT_LIST_DIR}/location_fuzz.cc
  ${PROJECT_SOURCE_DIR}/Sorvik/update/location.cc)
target_include_directories(location_fuzz PRIVATE ${PROJECT_SOURCE_DIR})
target_compile_options(location_fuzz PRIVATE -fsanitize=fuzzer)
target_link_options(location_fuzz PRIVATE -fsanitize=fuzzer)

if(SORVIK_BUILD_TESTS)
  # New inputs go to a scratch directory in the build tree, never into the seeds.
  set(_scratch ${CMAKE_CURRENT_BINARY_DIR}/location_corpus)
  file(MAKE_DIRECTORY ${_scratch})
  add_test(NAME location_fuzz
    COMMAND location_fuzz -max_total_time=5 -timeout=10 -rss_limit_mb=2048 -max_len=4096
            ${_scratch} ${CMAKE_CURRENT_LIST_DIR}/corpus/location)
  set_tests_properties(location_fuzz PROPERTIES TIMEOUT 60)
endif()
