# SQLite for the Windows build. Windows has no system SQLite to link, so the
# amalgamation is generated from Debian's sqlite3 source package by
# cmake/fetch-sqlite-amalgamation.sh and compiled with the cross-compiler into
# a static library, which the DLL takes in whole. Its symbols stay inside the
# DLL: nothing of SQLite is exported, so a host's own SQLite never meets ours.
#
# Defines SQLite::SQLite3, the same target name that find_package(SQLite3)
# gives on Linux, with the directory holding sqlite3.h as its include dir.
#
# The generated sources are cached in KOVPAGER_SQLITE_CACHE_DIR (default: in
# the build directory); the first build makes them, later builds, and builds
# after a clean, only copy them.

set(KOVPAGER_SQLITE_CACHE_DIR "${PROJECT_BINARY_DIR}/sqlite-amalgamation" CACHE PATH
    "Where the SQLite amalgamation is generated and kept")

set(_kov_sqlite_dir "${PROJECT_BINARY_DIR}/sqlite3")
file(MAKE_DIRECTORY "${_kov_sqlite_dir}")

# No DEPENDS: the amalgamation is a fixed input, made once when missing.
add_custom_command(
  OUTPUT "${_kov_sqlite_dir}/sqlite3.c" "${_kov_sqlite_dir}/sqlite3.h"
  COMMAND sh "${PROJECT_SOURCE_DIR}/cmake/fetch-sqlite-amalgamation.sh"
          "${KOVPAGER_SQLITE_CACHE_DIR}"
  COMMAND "${CMAKE_COMMAND}" -E copy
          "${KOVPAGER_SQLITE_CACHE_DIR}/sqlite3.c"
          "${KOVPAGER_SQLITE_CACHE_DIR}/sqlite3.h"
          "${KOVPAGER_SQLITE_CACHE_DIR}/sqlite3ext.h"
          "${_kov_sqlite_dir}/"
  COMMENT "SQLite amalgamation from Debian's sqlite3 sources"
  VERBATIM)
add_custom_target(kovpager_sqlite3_sources
  DEPENDS "${_kov_sqlite_dir}/sqlite3.c" "${_kov_sqlite_dir}/sqlite3.h")

add_library(kovpager_sqlite3 STATIC "${_kov_sqlite_dir}/sqlite3.c")
# Everything that includes sqlite3.h waits for it through this dependency.
add_dependencies(kovpager_sqlite3 kovpager_sqlite3_sources)
# As a system header, like the Linux one: the project's warning flags are not
# applied to it.
target_include_directories(kovpager_sqlite3 SYSTEM PUBLIC "${_kov_sqlite_dir}")
# SQLITE_API empty: the functions are plain externals of the static library,
# neither exported from nor imported into a DLL. On ELF platforms the hidden
# visibility below keeps them local; on Windows, where only what is marked
# for export leaves a DLL unless nothing is, the archive is also excluded
# from automatic export.
target_compile_definitions(kovpager_sqlite3 PRIVATE SQLITE_API=)
# The same compile-time options as Debian's own libsqlite3 (debian/rules of
# the source package), so the engine behaves alike on both platforms, down
# to the order of its file reads and writes.
target_compile_definitions(kovpager_sqlite3 PRIVATE
  SQLITE_SECURE_DELETE SQLITE_ENABLE_COLUMN_METADATA
  SQLITE_ENABLE_FTS3 SQLITE_ENABLE_FTS3_PARENTHESIS
  SQLITE_ENABLE_RTREE=1 SQLITE_SOUNDEX=1
  SQLITE_ENABLE_UNLOCK_NOTIFY
  SQLITE_OMIT_LOOKASIDE=1 SQLITE_ENABLE_DBSTAT_VTAB
  SQLITE_ALLOW_ROWID_IN_VIEW
  SQLITE_ENABLE_UPDATE_DELETE_LIMIT=1
  SQLITE_ENABLE_LOAD_EXTENSION
  SQLITE_ENABLE_JSON1
  SQLITE_LIKE_DOESNT_MATCH_BLOBS
  SQLITE_THREADSAFE=1
  SQLITE_ENABLE_FTS3_TOKENIZER=1
  SQLITE_USE_URI=1
  SQLITE_MAX_SCHEMA_RETRY=25
  SQLITE_ENABLE_PREUPDATE_HOOK
  SQLITE_ENABLE_SESSION
  SQLITE_ENABLE_STMTVTAB
  SQLITE_MAX_VARIABLE_NUMBER=250000)
target_compile_options(kovpager_sqlite3 PRIVATE -fno-strict-aliasing)
set_target_properties(kovpager_sqlite3 PROPERTIES
  C_VISIBILITY_PRESET hidden
  POSITION_INDEPENDENT_CODE ON)
if(MINGW)
  target_compile_options(kovpager_sqlite3 PRIVATE -fvisibility=hidden)
  target_link_options(kovpager_sqlite3 INTERFACE
    "$<$<STREQUAL:$<TARGET_PROPERTY:TYPE>,SHARED_LIBRARY>:LINKER:--exclude-libs,$<TARGET_FILE_NAME:kovpager_sqlite3>>")
endif()
find_package(Threads REQUIRED)
target_link_libraries(kovpager_sqlite3 PUBLIC Threads::Threads)

add_library(SQLite::SQLite3 ALIAS kovpager_sqlite3)
