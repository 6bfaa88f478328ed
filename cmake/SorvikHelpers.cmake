# sorvik_folder_library(NAME DEPS...): one static library per folder built from
# every *.cc in it except tests, plus a test executable from its *_test.cc
# files when there are any. Globbing keeps folder owners out of each other's
# CMake files.
function(sorvik_folder_library name)
  file(GLOB _all CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cc)
  file(GLOB _tests CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*_test.cc)
  cmake_parse_arguments(_a "" "" "SOURCES;EXCLUDE;DEPS;TEST_DEPS" ${ARGN})
  set(_srcs ${_all})
  if(_tests)
    list(REMOVE_ITEM _srcs ${_tests})
  endif()
  # Test files a platform build leaves out (POSIX-only tests in the Windows
  # build), as paths relative to the project root.
  foreach(_skip ${SORVIK_SKIPPED_TEST_FILES})
    list(REMOVE_ITEM _tests ${PROJECT_SOURCE_DIR}/${_skip})
  endforeach()
  foreach(_x ${_a_EXCLUDE})
    list(REMOVE_ITEM _srcs ${CMAKE_CURRENT_SOURCE_DIR}/${_x})
  endforeach()
  list(APPEND _srcs ${_a_SOURCES})
  if(NOT _srcs)
    # A folder whose code has not arrived yet still links.
    set(_srcs ${PROJECT_SOURCE_DIR}/cmake/empty.cc)
  endif()
  add_library(${name} STATIC ${_srcs})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(${name} PUBLIC ${_a_DEPS})
  if(SORVIK_BUILD_TESTS AND _tests)
    add_executable(${name}_tests ${_tests})
    target_link_libraries(${name}_tests PRIVATE ${name} ${_a_TEST_DEPS} GTest::gmock GTest::gtest GTest::gtest_main)
    gtest_discover_tests(${name}_tests DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120)
  endif()
endfunction()
