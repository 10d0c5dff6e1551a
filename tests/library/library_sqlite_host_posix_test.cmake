# A host that links the system's SQLite beside the shared library.
find_package(SQLite3 REQUIRED)
target_link_libraries(${KOV_TEST} PRIVATE SQLite::SQLite3 ${CMAKE_DL_LIBS})
kov_discover_tests(${KOV_TEST} TIMEOUT 300
  LARGE SqliteHost.HostSqliteKeepsItsTemporaryDirectoryAndFilesWhileTheStoreSpills)
