# The module's start-up and shutdown. Besides the test program (which links the store statically
# and counts its own atexit calls through a link-time wrapper) this builds:
#   module_host    a host program that reaches the shared library only through dlopen;
#   module_plugin  a loadable module that links the shared library and fills the store.
add_executable(module_host "${CMAKE_CURRENT_SOURCE_DIR}/hosts/module_host.cpp")
target_link_libraries(module_host PRIVATE kovpager_test_headers ${CMAKE_DL_LIBS})
kovpager_warnings(module_host)

add_library(module_plugin MODULE "${CMAKE_CURRENT_SOURCE_DIR}/hosts/module_plugin.cpp")
target_link_libraries(module_plugin PRIVATE kovpager)
kovpager_warnings(module_plugin)

target_link_options(${KOV_TEST} PRIVATE "LINKER:--wrap=atexit")
target_compile_definitions(${KOV_TEST} PRIVATE
  KOV_MODULE_HOST="$<TARGET_FILE:module_host>"
  KOV_MODULE_PLUGIN="$<TARGET_FILE:module_plugin>"
  KOV_LIBRARY="$<TARGET_FILE:kovpager>"
  KOV_LIBRARY_SONAME="$<TARGET_SONAME_FILE_NAME:kovpager>")
add_dependencies(${KOV_TEST} module_host module_plugin kovpager)

kov_discover_tests(${KOV_TEST} TIMEOUT 300
  LARGE ModuleLibrary.UnloadAfterUsePastTheCacheClosesTheEngineAndLeavesNothing
        ModuleExit.ProcessThatExitsAfterUseLeavesItsTemporaryDirectoryEmpty)
