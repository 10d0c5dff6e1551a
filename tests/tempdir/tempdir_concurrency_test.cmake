# Concurrency tests of the temporary-directory cache, labelled "concurrent" as well so that CI
# also runs them under ThreadSanitizer.
kov_discover_tests(${KOV_TEST} LABELS unit concurrent)
