# cmake -DDLL=sorvik.dll -DOBJDUMP=objdump -P WindowsCheckDll.cmake
# Fails unless the DLL exports exactly the six entry points under their
# plain names and imports no MinGW runtime DLL (the host machine has none).
execute_process(COMMAND ${OBJDUMP} -p ${DLL} OUTPUT_VARIABLE _dump RESULT_VARIABLE _rc)
if(NOT _rc EQUAL 0)
  message(FATAL_ERROR "${OBJDUMP} -p ${DLL} failed")
endif()

# Square brackets would confuse CMake's list splitting.
string(REPLACE "[" "<" _dump "${_dump}")
string(REPLACE "]" ">" _dump "${_dump}")
string(REGEX MATCH "<Ordinal/Name Pointer> Table[^\n]*\n(([ \t]+<[^\n]*\n)*)" _table "${_dump}")
string(REGEX MATCHALL ">[ \t]+[^ \t\n]+" _entries "${CMAKE_MATCH_1}")
set(_exports)
foreach(_e ${_entries})
  string(REGEX REPLACE "^>[ \t]+" "" _name "${_e}")
  list(APPEND _exports ${_name})
endforeach()
list(SORT _exports)
set(_expected Close IOCTL Load Open Unload Write)
if(NOT _exports STREQUAL _expected)
  message(FATAL_ERROR "exports are '${_exports}', expected '${_expected}'")
endif()

string(REGEX MATCHALL "DLL Name: [^\n]+" _imports "${_dump}")
foreach(_i ${_imports})
  string(TOLOWER "${_i}" _lower)
  if(_lower MATCHES "libstdc|libgcc|libwinpthread|mingw")
    message(FATAL_ERROR "${DLL} depends on a MinGW runtime DLL: ${_i}")
  endif()
endforeach()
message(STATUS "exports: ${_exports}; imports: ${_imports}")
