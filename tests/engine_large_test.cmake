# The engine's run past its page cache: about 100 MB through the temporary
# file. Labelled "unit" and "large" so that quick runs can leave it out
# (ctest -LE large).
#
# A list passed through gtest_discover_tests(PROPERTIES) is split into
# separate arguments on its way to the discovery script, so the labels are
# set by a small script that ctest runs after the discovered tests are
# loaded, from the test names the discovery leaves in TEST_LIST.
gtest_discover_tests(${KOV_TEST} DISCOVERY_TIMEOUT 60 TEST_LIST ${KOV_TEST}_TESTS)
set(_kov_labels_script "${CMAKE_CURRENT_BINARY_DIR}/${KOV_TEST}_labels.cmake")
file(WRITE "${_kov_labels_script}"
  "if(${KOV_TEST}_TESTS)\n"
  "  set_tests_properties(\${${KOV_TEST}_TESTS} PROPERTIES LABELS \"unit;large\" TIMEOUT 600)\n"
  "endif()\n")
set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES "${_kov_labels_script}")

# The open-file checks read /proc/self/fd, which only a Linux build can
# trust: a Windows build running under Wine finds the Unix /proc through
# drive Z:, but the handles listed there are not its own.
if(WIN32)
  target_compile_definitions(${KOV_TEST} PRIVATE KOV_TEST_PROC_FD=0)
else()
  target_compile_definitions(${KOV_TEST} PRIVATE KOV_TEST_PROC_FD=1)
endif()
