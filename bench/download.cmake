find_package(benchmark REQUIRED)
find_program(CURL_EXECUTABLE curl REQUIRED)
if(NOT TARGET sorvik_test_support)
  include(${PROJECT_SOURCE_DIR}/tests/support.cmake)
endif()
add_executable(download_bench ${CMAKE_CURRENT_LIST_DIR}/download_bench.cc)
target_compile_definitions(download_bench PRIVATE
  SORVIK_PLUGIN_PATH="$<TARGET_FILE:sorvik>"
  SORVIK_HOST_PATH="$<TARGET_FILE:sorvik-host>"
  CURL_PATH="${CURL_EXECUTABLE}")
target_link_libraries(download_bench PRIVATE sorvik_update sorvik_test_support benchmark::benchmark benchmark::benchmark_main)
add_dependencies(download_bench sorvik sorvik-host)
