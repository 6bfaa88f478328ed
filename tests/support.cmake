add_library(sorvik_test_support STATIC ${CMAKE_CURRENT_LIST_DIR}/support/http_file_server.cc
  ${CMAKE_CURRENT_LIST_DIR}/support/host_run.cc
  ${CMAKE_CURRENT_LIST_DIR}/support/host_session.cc)
target_include_directories(sorvik_test_support PUBLIC ${PROJECT_SOURCE_DIR})
target_link_libraries(sorvik_test_support PUBLIC sorvik_platform Threads::Threads)
