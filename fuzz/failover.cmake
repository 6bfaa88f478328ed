# libFuzzer target for the configuration intake. The intake and the host
# document parser are compiled into the target itself so that libFuzzer sees
# their coverage; the archive copies are then never pulled in.
if(NOT CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  message(STATUS "configuration_fuzz needs Clang; skipped")
  return()
endif()

add_executable(configuration_fuzz
  ${CMAKE_CURRENT_LIST_DIR}/configuration_fuzz.cc
  ${PROJECT_SOURCE_DIR}/Sorvik/service/configuration_intake.cc
  ${PROJECT_SOURCE_DIR}/Sorvik/plugin/xml_envelope.cc)
target_compile_options(configuration_fuzz PRIVATE -fsanitize=fuzzer)
target_link_options(configuration_fuzz PRIVATE -fsanitize=fuzzer)
target_link_libraries(configuration_fuzz PRIVATE sorvik_service sorvik_plugin)

if(SORVIK_BUILD_TESTS)
  # New inputs go to a scratch directory in the build tree, never into the seeds.
  set(_scratch ${CMAKE_CURRENT_BINARY_DIR}/configuration_corpus)
  file(MAKE_DIRECTORY ${_scratch})
  add_test(NAME configuration_fuzz
    COMMAND configuration_fuzz -max_total_time=5 -timeout=10 -rss_limit_mb=2048
            ${_scratch} ${CMAKE_CURRENT_LIST_DIR}/corpus/configuration)
  set_tests_properties(configuration_fuzz PROPERTIES TIMEOUT 60)
endif()
