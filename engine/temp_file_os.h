// The platform seam of the temporary-file layer (engine/temp_file.h):
// temp_file_posix.cpp and temp_file_win32.cpp each provide these calls for
// their system. Every call reports through an SQLite result code; a failure
// that the message should explain leaves the system's words in *error.
#ifndef KOVPAGER_ENGINE_TEMP_FILE_OS_H
#define KOVPAGER_ENGINE_TEMP_FILE_OS_H

#include <cstdint>
#include <string>

namespace kov::engine::tempfile {

// A file descriptor on POSIX, a HANDLE on Windows.
using Handle = std::intptr_t;
inline constexpr Handle kNoHandle = -1;

// Makes a new file in `directory` (narrow text, no trailing separator; empty for the root) under
// `name`: created exclusively (an existing name, a symbolic link included, is
// SQLITE_CANTOPEN with *exists set, so the caller tries another name),
// readable and writable by the process's user only, gone from the directory
// or deleted on close as engine/temp_file.h says. SQLITE_OK or
// SQLITE_CANTOPEN.
int create(const std::string& directory, const std::string& name, Handle* out, bool* exists,
           std::string* error);

// Reads up to `amount` bytes at `offset`; *got receives how many were there
// (fewer at the end of the file). SQLITE_OK or SQLITE_IOERR_READ.
int readAt(Handle file, void* buffer, int amount, std::int64_t offset, int* got,
           std::string* error);

// Writes every byte. SQLITE_OK, SQLITE_FULL, or SQLITE_IOERR_WRITE.
int writeAt(Handle file, const void* buffer, int amount, std::int64_t offset, std::string* error);

// Holds room on the file system for bytes [from, to) of the file (from < to).
// SQLITE_OK, SQLITE_FULL, or SQLITE_IOERR_WRITE.
int reserve(Handle file, std::int64_t from, std::int64_t to, std::string* error);

// Gives back the room held past `keep` bytes (nothing the file holds lies there).
// SQLITE_OK or SQLITE_IOERR_TRUNCATE.
int release(Handle file, std::int64_t keep, std::string* error);

// SQLITE_OK or SQLITE_IOERR_FSTAT.
int size(Handle file, std::int64_t* out, std::string* error);

// SQLITE_OK or SQLITE_IOERR_TRUNCATE.
int truncate(Handle file, std::int64_t size, std::string* error);

void close(Handle file);

}  // namespace kov::engine::tempfile

#endif  // KOVPAGER_ENGINE_TEMP_FILE_OS_H
