find_package(benchmark REQUIRED)
add_executable(ipc_bench ${CMAKE_CURRENT_LIST_DIR}/ipc_bench.cc)
target_link_libraries(ipc_bench PRIVATE sorvik_fake_host sorvik_ipc benchmark::benchmark benchmark::benchmark_main)
