// The library's private SQLite, under the library's own names (see
// cmake/SqliteAmalgamation.cmake): `sqlite3_open_v2` here calls the copy
// compiled into the library, never a system SQLite of the same program.
// Needs the include directories of the kovpager_sqlite_api target.
//
// Where engine/btree.h is needed too, include it first: its result codes
// share SQLite's macro names and values.
#ifndef KOVPAGER_ENGINE_PRIVATE_SQLITE3_H
#define KOVPAGER_ENGINE_PRIVATE_SQLITE3_H

#include "kovpager_sqlite3_names.h"

#include <sqlite3.h>

#endif  // KOVPAGER_ENGINE_PRIVATE_SQLITE3_H
