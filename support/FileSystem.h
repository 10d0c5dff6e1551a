// The platform seam of the file objects: every call they make to the
// operating system goes through one FileSystem instance. FileSystem_posix.cpp
// and FileSystem_win32.cpp each provide the host's instance; tests may put
// their own in its place with TEST_setFileSystem (for instance to make a
// rename fail as it does between devices).
//
// Paths are native-form UTF-8 text (on POSIX the bytes given). Every call
// reports failure through its result and never throws for a file-system
// error.
#ifndef KOVPAGER_SUPPORT_FILESYSTEM_H
#define KOVPAGER_SUPPORT_FILESYSTEM_H

#include <cstdint>
#include <fstream>
#include <ios>
#include <new>
#include <string>
#include <vector>

#include "support/NativePath.h"

namespace kov::fs {

// What a status call learns about a path.
struct Status {
    std::uint16_t mode = 0;  // st_mode bits
    bool directory = false;  // the mode's directory bit
    std::int64_t size = 0;
    std::int64_t modificationTime = 0;
    std::int64_t accessTime = 0;
    std::int64_t creationTime = 0;
    std::uint32_t device = 0;
};

// One entry of a listing, as the listing saw it (a symbolic link counts as
// a file, so a recursive removal never follows one).
struct Entry {
    std::string name;  // UTF-8
    bool directory = false;
};

class FileSystem {
  public:
    virtual ~FileSystem() = default;

    // The path style of the platform.
    virtual kov::path::PathStyle style() const = 0;
    // _wstat64 / stat (following links).
    virtual bool status(const std::string& path, Status& out) = 0;
    // True when a network share root (a path beginning with two separators)
    // is reported as a directory (GetFileAttributesW); false on POSIX.
    virtual bool shareIsDirectory(const std::string& path) = 0;
    virtual bool makeDirectory(const std::string& path) = 0;
    virtual bool removeFile(const std::string& path) = 0;
    virtual bool removeDirectory(const std::string& path) = 0;
    // True when `path` itself is a symbolic link (or, on Windows, any reparse
    // point such as a junction): removal takes the link away, never what it
    // points to.
    virtual bool isLink(const std::string& path) = 0;
    virtual bool removeLink(const std::string& path) = 0;
    // Copies a regular file; with `failIfExists` an existing target is an error.
    virtual bool copyFile(const std::string& from, const std::string& to, bool failIfExists) = 0;
    // Renames, replacing an existing target; false when it cannot (a move
    // between devices included).
    virtual bool moveFile(const std::string& from, const std::string& to) = 0;
    // The names in a directory without "." and ".."; false when it cannot be
    // read (the names read before the failure stay in `out`).
    virtual bool list(const std::string& path, std::vector<Entry>& out) = 0;
    // The current time in seconds since the epoch.
    virtual std::int64_t now() = 0;
    // Opens `stream` on `path` with `mode`, denying other openers nothing.
    virtual void openStream(std::fstream& stream, const std::string& path,
                            std::ios_base::openmode mode) = 0;
};

// The host's file system (never null).
FileSystem& hostFileSystem();

// The one object of type T, built on first use in static storage and never destroyed, so that
// code running at exit may still use it: each platform's hostFileSystem() returns one.
template <class T>
T& everlasting() {
    alignas(T) static unsigned char storage[sizeof(T)];
    static T* instance = new (storage) T;
    return *instance;
}

// The instance the file objects use: the host's unless a test replaced it.
FileSystem& fileSystem();

// Replaces the instance in use (null restores the host's) and returns the
// previous one. For tests only; not synchronised.
FileSystem* TEST_setFileSystem(FileSystem* replacement);

}  // namespace kov::fs

#endif  // KOVPAGER_SUPPORT_FILESYSTEM_H
