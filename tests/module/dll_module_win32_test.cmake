# The DLL's load and unload on Windows. Besides the test program this builds:
#   dll_host_win32         a host program that reaches the DLL only through LoadLibrary;
#   dll_host_win32_plugin  a DLL that links the store's DLL and fills the store.
# The test program finds them, and the store's DLL, relative to its own directory.
add_executable(dll_host_win32 "${CMAKE_CURRENT_SOURCE_DIR}/hosts/dll_host_win32.cpp")
# support/Win32Api.h and the tests' host helpers only: the host never links the store.
target_include_directories(dll_host_win32 PRIVATE "${PROJECT_SOURCE_DIR}")
target_link_libraries(dll_host_win32 PRIVATE kovpager_test_headers)
kovpager_warnings(dll_host_win32)

add_library(dll_host_win32_plugin MODULE "${CMAKE_CURRENT_SOURCE_DIR}/hosts/module_plugin.cpp")
set_target_properties(dll_host_win32_plugin PROPERTIES PREFIX "")
target_link_libraries(dll_host_win32_plugin PRIVATE kovpager)
kovpager_warnings(dll_host_win32_plugin)

file(RELATIVE_PATH _kov_tests_to_library "${CMAKE_CURRENT_BINARY_DIR}" "${PROJECT_BINARY_DIR}")
if(_kov_tests_to_library STREQUAL "")
  set(_kov_tests_to_library ".")
endif()
target_compile_definitions(${KOV_TEST} PRIVATE
  KOV_LIBRARY_FROM_TESTS="${_kov_tests_to_library}/$<TARGET_FILE_NAME:kovpager>"
  KOV_DLL_HOST="$<TARGET_FILE_NAME:dll_host_win32>"
  KOV_DLL_PLUGIN="$<TARGET_FILE_NAME:dll_host_win32_plugin>")
# NtQueryInformationProcess, to find the loader's list of modules.
target_link_libraries(${KOV_TEST} PRIVATE ntdll)
add_dependencies(${KOV_TEST} dll_host_win32 dll_host_win32_plugin kovpager)

kov_discover_tests(${KOV_TEST} TIMEOUT 300)

# The DLL exports the members of its three classes and nothing else: no
# helper of ours, no standard-library instantiation, no SQLite.
add_test(NAME Library.DllExportsOnlyTheThreeClasses
  COMMAND sh "${CMAKE_CURRENT_SOURCE_DIR}/library/check_dll_exports.sh" "$<TARGET_FILE:kovpager>"
          "${CMAKE_OBJDUMP}")
set_tests_properties(Library.DllExportsOnlyTheThreeClasses PROPERTIES LABELS "unit")
