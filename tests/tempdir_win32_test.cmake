# Temporary-directory resolution on Windows. Some of these tests make and
# remove c:\temp, c:\tmp and D:\scratch, shared by every process of the Wine
# prefix (or of the machine), so they never run beside each other.
gtest_discover_tests(${KOV_TEST} DISCOVERY_TIMEOUT 60
  PROPERTIES LABELS "unit" RESOURCE_LOCK kovpager_fixed_temp_directories)
