# The reference failback agent. Its file name must stay exactly "kelp": the
# plug-in finds running agents by the executable's base name.
set(_kelp_dir ${CMAKE_CURRENT_LIST_DIR})
file(GLOB _kelp_core_sources CONFIGURE_DEPENDS ${_kelp_dir}/kelp_*.cc)
list(REMOVE_ITEM _kelp_core_sources ${_kelp_dir}/kelp_main.cc)
if(_kelp_core_sources)
  add_library(sorvik_kelp_core STATIC ${_kelp_core_sources})
  target_include_directories(sorvik_kelp_core PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(sorvik_kelp_core PUBLIC Threads::Threads)

  add_executable(kelp ${_kelp_dir}/kelp_main.cc)
  target_link_libraries(kelp PRIVATE sorvik_kelp_core)
  set_target_properties(kelp PROPERTIES OUTPUT_NAME kelp RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
endif()
