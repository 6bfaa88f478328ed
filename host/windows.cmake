# The Windows build of the development host and the reference agent:
# sorvik-host.exe and kelp.exe. The platform-neutral parts of host/ are
# shared with the POSIX build; the process runner, the console and the
# agent's socket server have Win32 twins in host/windows_*.cc.
if(NOT WIN32)
  return()
endif()

set(_host_dir ${CMAKE_CURRENT_LIST_DIR})
file(GLOB _host_shared CONFIGURE_DEPENDS ${_host_dir}/sorvik_host_*.cc)
list(REMOVE_ITEM _host_shared ${_host_dir}/sorvik_host_main.cc)
add_library(sorvik_host_core STATIC ${_host_shared}
  ${_host_dir}/process_runner.cc
  # Loads the plug-in through <dlfcn.h>, which sorvik_posix_compat provides.
  ${_host_dir}/posix_plugin_library.cc
  ${_host_dir}/windows_process_runner.cc
  ${_host_dir}/windows_command_line.cc)
target_include_directories(sorvik_host_core PUBLIC ${PROJECT_SOURCE_DIR})
target_link_libraries(sorvik_host_core PUBLIC
  sorvik_ipc sorvik_plugin sorvik_platform tinyxml_pkg sorvik_posix_compat Threads::Threads)

if(EXISTS ${_host_dir}/windows_host_main.cc)
  add_executable(sorvik-host ${_host_dir}/windows_host_main.cc)
  target_link_libraries(sorvik-host PRIVATE sorvik_host_core)
endif()

# kelp.exe: the agent's option parsing, listing and wiping are shared; its
# listening socket is Winsock.
file(GLOB _kelp_shared CONFIGURE_DEPENDS ${_host_dir}/kelp_*.cc)
list(REMOVE_ITEM _kelp_shared ${_host_dir}/kelp_main.cc ${_host_dir}/kelp_posix_server.cc)
add_library(sorvik_kelp_core STATIC ${_kelp_shared} ${_host_dir}/windows_kelp_server.cc)
target_include_directories(sorvik_kelp_core PUBLIC ${PROJECT_SOURCE_DIR})
target_link_libraries(sorvik_kelp_core PUBLIC sorvik_posix_compat Threads::Threads ws2_32)
add_executable(kelp ${_host_dir}/kelp_main.cc)
target_link_libraries(kelp PRIVATE sorvik_kelp_core)
