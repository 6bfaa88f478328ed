add_executable(sorvik-load ${CMAKE_CURRENT_LIST_DIR}/plugin_loader.cc)
target_include_directories(sorvik-load PRIVATE ${PROJECT_SOURCE_DIR})
target_link_libraries(sorvik-load PRIVATE sorvik_plugin ${CMAKE_DL_LIBS})
add_dependencies(sorvik-load sorvik)
