// The private SQLite's file layer for the store's temporary database.
//
// SQLite's own layers choose a temporary file's directory themselves: on
// POSIX they skip a directory they cannot write and fall back to others
// (TMPDIR, /var/tmp, /usr/tmp, /tmp, the working directory). The store's
// file belongs in the directory chosen for it and nowhere else, so the
// engine registers this layer as the private SQLite's default file layer
// (installTemporaryFiles) and every temporary file SQLite asks for is made
// here:
//
//   - in the directory named by the engine's temporary-directory setting
//     (temporaryDirectorySetting, narrow text), and only there: when the file
//     cannot be made there (no setting, a directory that is missing,
//     read-only or not ours to write) the open fails with SQLITE_CANTOPEN and
//     lastTemporaryFileError() says why;
//   - created exclusively under a fresh random name, never through a
//     symbolic link, readable and writable by the process's own user only;
//     on POSIX removed from the directory as soon as it is made (a crash
//     leaves nothing behind), on Windows opened for this process alone and
//     deleted when closed.
//
// A file opened by name (the store opens none) goes to the platform's own
// layer unchanged.
//
// Reserving space. A file of this layer answers the file control
// KOVSQ_FCNTL_RESERVE (engine/sqlite_btree.h) with an sqlite3_int64 byte
// count: from then on the file system holds room for that many bytes of the
// file (posix_fallocate on POSIX, an allocation size on Windows), so that a
// write below that offset never meets a full disk. SQLITE_FULL when the room
// is not there (lastTemporaryFileError() has the system's words), another
// SQLITE_IOERR code when the system refused for another reason; either way
// the file is as before. The engine reserves ahead of the pages it holds
// (engine/btree.cpp, "Space").
//
// Single-threaded, like the private SQLite (SQLITE_THREADSAFE=0).
#ifndef KOVPAGER_ENGINE_TEMP_FILE_H
#define KOVPAGER_ENGINE_TEMP_FILE_H

#include <string>

namespace kov::engine {

// The name this layer is registered under.
inline constexpr const char* kTemporaryFileLayer = "kovpager-temp";

// Hands the page cache to SQLite (engine/page_cache.h: it must come first)
// and registers this layer as the private SQLite's default, once per
// process. False when SQLite refused the registration.
bool installTemporaryFiles();

// What the system said at this layer's last failure to make a file or
// reserve space, with the directory: one phrase for a message, for example
// "cannot make a file in /ro: Read-only file system". Empty before any.
const std::string& lastTemporaryFileError();
// Forgets it, before an attempt whose failure should be told alone.
void clearTemporaryFileError();

}  // namespace kov::engine

#endif  // KOVPAGER_ENGINE_TEMP_FILE_H
