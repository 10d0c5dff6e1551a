# The store past ten times its page cache (over 640 MiB through the temporary file), labelled
# "large" as well so that quick runs can leave it out (ctest -LE large).
kov_discover_tests(${KOV_TEST} LABELS unit large TIMEOUT 600)
