# libFuzzer target for the command intake. The intake and the host document
# parser are compiled into the target itself so that libFuzzer sees their
# coverage; the archive copies are then never pulled in.
if(NOT CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  message(STATUS "command_fuzz needs Clang; skipped")
  return()
endif()

add_executable(command_fuzz
  ${CMAKE_CURRENT_LIST_DIR}/command_fuzz.cc
  ${PROJECT_SOURCE_DIR}/Sorvik/service/command_intake.cc
  ${PROJECT_SOURCE_DIR}/Sorvik/plugin/xml_envelope.cc)
target_compile_options(command_fuzz PRIVATE -fsanitize=fuzzer)
target_link_options(command_fuzz PRIVATE -fsanitize=fuzzer)
target_link_libraries(command_fuzz PRIVATE sorvik_service sorvik_plugin)

if(SORVIK_BUILD_TESTS)
  # New inputs go to a scratch directory in the build tree, never into the seeds.
  set(_scratch ${CMAKE_CURRENT_BINARY_DIR}/command_corpus)
  file(MAKE_DIRECTORY ${_scratch})
  add_test(NAME command_fuzz
    COMMAND command_fuzz -max_total_time=5 -timeout=10 -rss_limit_mb=2048
            ${_scratch} ${CMAKE_CURRENT_LIST_DIR}/corpus/command)
  # Runs in the build tree, where no update.xml of a real host can be read.
  set_tests_properties(command_fuzz PROPERTIES TIMEOUT 60 WORKING_DIRECTORY ${_scratch})
endif()
