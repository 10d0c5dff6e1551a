// The path record: one component of a path, linked to the record of its
// parent component, with the status last read from the file system.
//
// Records are shared through std::shared_ptr between a file object, the
// objects copied from it and the entries listed from it; the sharing is by
// reference count only, and a record carries no lock. The full path is the
// chain read from its root (the record whose parent is null).
//
// The cached status is deliberate: once statusRead_ is set, nothing reads
// the disk again until a forced refresh (see KovFile::refresh).
#ifndef KOVPAGER_SUPPORT_FILEINFO_H
#define KOVPAGER_SUPPORT_FILEINFO_H

#include <cstdint>
#include <memory>
#include <string>

#include "support/Text.h"

namespace lumo::ex {

struct FileInfo {
    // Kinds of a path.
    enum Kind : std::int32_t { kUnknown = 0, kFile = 1, kDirectory = 2 };

    kov::text::Utf8Text name_;          // this component, UTF-8
    std::shared_ptr<FileInfo> parent_;  // the parent component, null at the root
    std::uint8_t statusRead_ = 0;       // a status query has been made (or presumed)
    std::uint8_t exists_ = 0;           // the path exists
    std::int32_t kind_ = kUnknown;      // a Kind
    // 0: names compare case-sensitively; 1: ignoring case, no case
    // resolution; other: ignoring case, with case resolution.
    std::int32_t caseMode_ = 0;
    std::int32_t statValid_ = 0;         // the last status call succeeded
    std::uint16_t mode_ = 0;             // st_mode of the last status call
    std::int64_t size_ = 0;              // bytes
    std::int64_t modificationTime_ = 0;  // seconds since the epoch
    std::int64_t accessTime_ = 0;        // seconds since the epoch
    std::int64_t creationTime_ = 0;      // seconds (on POSIX: status change time)
    std::uint32_t device_ = 0;           // st_dev (on Windows the drive number)

    // The full path in native form (UTF-8), read from the root of the chain.
    std::string fullPath() const;

    // Sets the kind; a kind different from the stored one clears exists_.
    void setKind(std::int32_t kind);

    // Builds the record chain of `path` (UTF-8 text, any form) and returns its
    // last record, or null for a path with no component (empty, or only
    // Windows separators). Every record of the chain takes `caseMode` and,
    // when `presumedExisting`, is marked read and existing. Root records
    // (".", "/" on POSIX; ".", "X:", "\\" on Windows) are marked read and
    // existing whatever the flag, "." and drives as directories.
    static std::shared_ptr<FileInfo> fromPath(const std::string& path, std::int32_t caseMode,
                                              bool presumedExisting);
};

}  // namespace lumo::ex

#endif  // KOVPAGER_SUPPORT_FILEINFO_H
