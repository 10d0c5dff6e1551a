# The store under injected I/O failures, past its 64 MiB cache (about 90 MB of records per run).
# The fault-injecting VFS is a test-only source compiled into this program alone. About 30 s
# plain but minutes under AddressSanitizer, so labelled "unit" and "large" (the sanitizer pass
# leaves "large" out).
#
# The labels are set by a script that ctest runs after the discovered tests are loaded: a list
# handed to gtest_discover_tests(PROPERTIES) is split on its way to the discovery script.
target_sources(${KOV_TEST} PRIVATE "${CMAKE_CURRENT_SOURCE_DIR}/fault_vfs.cpp")
gtest_discover_tests(${KOV_TEST} DISCOVERY_TIMEOUT 60 TEST_LIST ${KOV_TEST}_TESTS
  PROPERTIES TIMEOUT 600)
set(_kov_labels_script "${CMAKE_CURRENT_BINARY_DIR}/${KOV_TEST}_labels.cmake")
file(WRITE "${_kov_labels_script}"
  "if(${KOV_TEST}_TESTS)\n"
  "  set_tests_properties(\${${KOV_TEST}_TESTS} PROPERTIES LABELS \"unit;large\")\n"
  "endif()\n")
set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES "${_kov_labels_script}")
