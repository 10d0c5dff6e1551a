# The engine's run past its page cache: about 100 MB through the temporary
# file. Labelled "large" as well, so that quick runs can leave it out
# (ctest -LE large).
kov_discover_tests(${KOV_TEST} LABELS unit large TIMEOUT 600)

# The open-file checks read /proc/self/fd, which only a Linux build can
# trust: a Windows build running under Wine finds the Unix /proc through
# drive Z:, but the handles listed there are not its own.
if(WIN32)
  target_compile_definitions(${KOV_TEST} PRIVATE KOV_TEST_PROC_FD=0)
else()
  target_compile_definitions(${KOV_TEST} PRIVATE KOV_TEST_PROC_FD=1)
endif()
