# Concurrency tests of the temporary-directory cache, labelled "unit" and "concurrent" so that CI
# also runs them under ThreadSanitizer.
#
# The labels are set by a small script that ctest runs after the discovered tests are loaded:
# a list passed through gtest_discover_tests(PROPERTIES) is split into separate arguments on its
# way to the discovery script, so "unit;concurrent" cannot go that way. The discovery leaves the
# names of the tests in the variable named by TEST_LIST for exactly this use.
gtest_discover_tests(${KOV_TEST} DISCOVERY_TIMEOUT 60 TEST_LIST ${KOV_TEST}_TESTS)
set(_kov_labels_script "${CMAKE_CURRENT_BINARY_DIR}/${KOV_TEST}_labels.cmake")
file(WRITE "${_kov_labels_script}"
  "if(${KOV_TEST}_TESTS)\n"
  "  set_tests_properties(\${${KOV_TEST}_TESTS} PROPERTIES LABELS \"unit;concurrent\")\n"
  "endif()\n")
set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES "${_kov_labels_script}")
