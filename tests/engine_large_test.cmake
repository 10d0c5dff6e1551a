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
