# The store past ten times its page cache (over 640 MiB through the temporary file), labelled
# "unit" and "large" so that quick runs can leave it out (ctest -LE large).
#
# The labels are set by a script that ctest runs after the discovered tests are loaded: a list
# handed to gtest_discover_tests(PROPERTIES) is split on its way to the discovery script.
gtest_discover_tests(${KOV_TEST} DISCOVERY_TIMEOUT 60 TEST_LIST ${KOV_TEST}_TESTS
  PROPERTIES TIMEOUT 600)
set(_kov_labels_script "${CMAKE_CURRENT_BINARY_DIR}/${KOV_TEST}_labels.cmake")
file(WRITE "${_kov_labels_script}"
  "if(${KOV_TEST}_TESTS)\n"
  "  set_tests_properties(\${${KOV_TEST}_TESTS} PROPERTIES LABELS \"unit;large\")\n"
  "endif()\n")
set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES "${_kov_labels_script}")
