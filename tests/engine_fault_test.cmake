# The engine binding under injected I/O failures. The fault-injecting VFS is
# a test-only source compiled into this program alone; the library never
# registers it.
target_sources(${KOV_TEST} PRIVATE "${CMAKE_CURRENT_SOURCE_DIR}/fault_vfs.cpp")
kov_discover_tests(${KOV_TEST})
