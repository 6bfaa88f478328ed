# The development host: sorvik-host loads the plug-in, drives it like the
# recording server does and runs its child processes for real. The core
# library holds everything but main() so tests can use the pieces.
set(_sorvik_host_dir ${CMAKE_CURRENT_LIST_DIR})
file(GLOB _sorvik_host_core_sources CONFIGURE_DEPENDS
  ${_sorvik_host_dir}/sorvik_host_*.cc
  ${_sorvik_host_dir}/process_runner*.cc
  ${_sorvik_host_dir}/posix_*.cc)
list(REMOVE_ITEM _sorvik_host_core_sources ${_sorvik_host_dir}/sorvik_host_main.cc)
add_library(sorvik_host_core STATIC ${_sorvik_host_core_sources})
target_include_directories(sorvik_host_core PUBLIC ${PROJECT_SOURCE_DIR})
target_link_libraries(sorvik_host_core PUBLIC sorvik_ipc sorvik_plugin sorvik_platform tinyxml_pkg Threads::Threads ${CMAKE_DL_LIBS})

add_executable(sorvik-host ${_sorvik_host_dir}/sorvik_host_main.cc)
target_link_libraries(sorvik-host PRIVATE sorvik_host_core)
set_target_properties(sorvik-host PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
