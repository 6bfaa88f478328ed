find_package(benchmark REQUIRED)
add_executable(plugin_bench ${CMAKE_CURRENT_LIST_DIR}/plugin_bench.cc)
target_link_libraries(plugin_bench PRIVATE sorvik_plugin benchmark::benchmark benchmark::benchmark_main)
