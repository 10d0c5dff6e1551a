# The store program (store_program.h) as a test library compiled once: the model test, the fault
# test, the fuzz target and its regression test, and the soak program link it.
add_library(kov_store_program STATIC "${CMAKE_CURRENT_LIST_DIR}/store_program.cpp")
target_include_directories(kov_store_program PUBLIC "${CMAKE_CURRENT_LIST_DIR}")
target_link_libraries(kov_store_program PUBLIC kovpager_core kovpager_sqlite_api)
kovpager_warnings(kov_store_program)
