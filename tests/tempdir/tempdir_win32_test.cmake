# Temporary-directory resolution on Windows. Some of these tests make and
# remove c:\temp, c:\tmp and D:\scratch, shared by every process of the Wine
# prefix (or of the machine), so they never run beside each other.
kov_discover_tests(${KOV_TEST} RESOURCE_LOCK kovpager_fixed_temp_directories)
