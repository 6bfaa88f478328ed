find_package(benchmark REQUIRED)
add_executable(update_bench ${CMAKE_CURRENT_LIST_DIR}/update_bench.cc)
target_link_libraries(update_bench PRIVATE sorvik_update sorvik_fake_host benchmark::benchmark benchmark::benchmark_main)
