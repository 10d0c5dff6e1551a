# Test code compiled once into a static library for every program that uses it: the store program
# (store_program.h; the model test, the fault test, the fuzz target and its regression test, the
# soak program) and the fault-injecting VFS (fault_vfs.h; the engine and store fault tests, the
# soak program). The library itself never registers that VFS.
add_library(kov_store_program STATIC
  "${CMAKE_CURRENT_LIST_DIR}/store_program.cpp"
  "${CMAKE_CURRENT_LIST_DIR}/fault_vfs.cpp")
target_include_directories(kov_store_program PUBLIC "${CMAKE_CURRENT_LIST_DIR}")
target_link_libraries(kov_store_program PUBLIC kovpager_core kovpager_sqlite_api)
kovpager_warnings(kov_store_program)
