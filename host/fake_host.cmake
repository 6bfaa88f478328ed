# The in-process stand-in for the host server that tests run the plug-in
# against. No test framework inside: any test or benchmark can link it.
add_library(sorvik_fake_host STATIC ${CMAKE_CURRENT_LIST_DIR}/fake_host.cc)
target_link_libraries(sorvik_fake_host PUBLIC sorvik_ipc sorvik_plugin Threads::Threads)
