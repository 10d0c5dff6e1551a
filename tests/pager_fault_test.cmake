# The store under injected I/O failures, past its 64 MiB cache (about 90 MB of records per run).
# The fault-injecting VFS is a test-only source compiled into this program alone. Seconds plain
# but minutes under AddressSanitizer, so labelled "large" as well (the sanitizer pass leaves
# "large" out).
target_sources(${KOV_TEST} PRIVATE "${CMAKE_CURRENT_SOURCE_DIR}/fault_vfs.cpp")
kov_discover_tests(${KOV_TEST} LABELS unit large TIMEOUT 600)
