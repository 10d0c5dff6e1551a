# The store under injected I/O failures, past its 64 MiB cache (about 90 MB of records per run).
# Seconds plain but minutes under AddressSanitizer, so labelled "large" as well (the sanitizer
# pass leaves "large" out).
kov_discover_tests(${KOV_TEST} LABELS unit large TIMEOUT 600)
