// KovFile: a file-system path with cached status and the operations to
// create, remove, copy, move and open the file it names.
//
//   lumo::ex::KovFile f(kov::text::Utf8Text("/var/tmp/a.dat"));
//   if (!f.exists() && f.create()) f.copyTo(std::string("/var/tmp/b.dat"), false);
//
// A KovFile holds a shared path record (FileInfo). Copies share the record,
// so a status read through one is seen by all. An object made from an empty
// path has no record: it does not exist and every operation fails.
//
// Failures are reported as false (or 0), never by an exception; only the
// allocation and length errors of the standard containers propagate. Status
// is cached: exists(), size() and the rest read the disk once, and again
// only after refresh(true) or an operation that changes the file.
//
// Path styles: path(2) / pathText(2) give the native form (on Windows
// backslashes, on POSIX slashes); any other style gives the portable form,
// with "/" as the separator.
//
// Thread safety: none. Objects, and the records they share, are used from
// one thread at a time.
#ifndef KOVPAGER_SUPPORT_KOVFILE_H
#define KOVPAGER_SUPPORT_KOVFILE_H

#include <cstdint>
#include <cstdio>
#include <fstream>
#include <ios>
#include <memory>
#include <string>

#include "support/FileInfo.h"
#include "support/Text.h"

namespace lumo::ex {

class KovDirectory;

class KovFile {
  public:
    // Something an outside user can hang on a file object; destroyed with it.
    struct Attachment {
        virtual ~Attachment() = default;
    };

    // From a path in UTF-8. `caseMode` and `presumedExisting` are passed to
    // the path record (see FileInfo::fromPath).
    explicit KovFile(const kov::text::Utf8Text& path, std::int32_t caseMode = 0,
                     bool presumedExisting = false);
    // On an existing path record (may be null: no file).
    explicit KovFile(std::shared_ptr<FileInfo> info);
    // A second object on the same record, with the same flags; no stream.
    KovFile(const KovFile& other);
    // The entry `name` of `parent`. With `option` 1 the entry was just listed:
    // it is marked read and existing, with `kind` as the listing saw it.
    KovFile(const KovDirectory& parent, const kov::text::Utf8Text& name, int option = 1,
            std::int32_t kind = FileInfo::kUnknown);
    // Shares `other`'s record and flags; closes this object's streams first.
    KovFile& operator=(const KovFile& other);
    // close(), then releases the attachment and the share of the record.
    virtual ~KovFile();

    // False when there is no record; otherwise refresh(false), resolveCase(),
    // then the record's exists flag.
    bool exists();

    // The path as UTF-8 text / as narrow text (on Windows ANSI, lossy).
    // Style 2 is the native form; other styles the portable form.
    kov::text::Utf8Text pathText(int style) const;
    std::string path(int style) const;

    // Finds the name as written on disk when this path is missing but a
    // sibling differs from it only in case. Runs once per object, never with
    // case mode 1, and only under a parent record (the one name of a
    // relative path is not resolved).
    virtual void resolveCase();
    // The root kind of the first record of the path (see KovDirectory).
    virtual int rootKind();
    // Size in bytes; 0 when the status cannot be read.
    virtual std::int64_t size();
    // Times in seconds since the epoch; 0 when the status cannot be read.
    virtual std::int64_t modificationTime();
    virtual std::int64_t accessTime();
    virtual std::int64_t creationTime();
    // Creates an empty file, and first its missing parent directories. True
    // at once, touching nothing, when the path exists already (a directory
    // of that name included). False for a path without a parent record (a
    // root, or the one name of a relative path such as "bar").
    virtual bool create();
    // Deletes the file. True when there is nothing to delete. A directory is
    // handed to directory removal whose result is ignored (true).
    virtual bool remove();
    // Copies to `destination` (narrow host text / UTF-8), creating its parent.
    // Without `overwrite` an existing destination is left alone (false).
    virtual bool copyTo(const std::string& destination, bool overwrite);
    virtual bool copyTo(const kov::text::Utf8Text& destination, bool overwrite);
    // Moves or renames to `destination`: a rename on the same device, else
    // (or when the rename fails) a copy then a removal of the source. On
    // success this object names the destination; on failure the source.
    virtual bool moveTo(const std::string& destination, bool overwrite);
    virtual bool moveTo(const kov::text::Utf8Text& destination, bool overwrite);
    // Reads the status into the record; unless `force`, only once.
    virtual bool refresh(bool force);

    // Opens the file stream with `mode` (the standard open modes). Input,
    // at-end and append need an existing file. False for a directory or when
    // a stdio handle is attached. True when the stream is open and good.
    bool open(std::ios_base::openmode mode);
    // Closes the stdio handle and the file stream; true when either closed.
    bool close();

    // The open stream, or null.
    std::fstream* stream() { return stream_.get(); }
    // Hands a C stdio handle to this object; close() will fclose it.
    void adoptStdio(std::FILE* handle);
    // Hangs `attachment` on this object (replacing any earlier one).
    void attach(std::unique_ptr<Attachment> attachment) { attachment_ = std::move(attachment); }

    // The path record (may be null).
    const std::shared_ptr<FileInfo>& info() const { return info_; }
    // This component's name (UTF-8); empty without a record.
    kov::text::Utf8Text name() const;
    // The kind (FileInfo::Kind), reading the status when it is not known.
    std::int32_t kind();
    // The device number; 0 when the status cannot be read.
    std::uint32_t device();

  protected:
    // The directory holding this path: the parent record, or "." for the first
    // component of a relative path. Null for a root record or without a record.
    std::unique_ptr<KovDirectory> parentDirectory() const;
    // True when this path is the first record of its chain and that record is
    // a root ("/", ".", "C:", "\", "\\").
    bool isChainRoot() const;
    // Reads the status unless it is valid; false when it cannot be read.
    bool ensureStat();

    std::shared_ptr<FileInfo> info_;          // the path record, or null
    std::unique_ptr<Attachment> attachment_;  // owned, may be null
    std::uint8_t caseResolved_ = 0;           // resolveCase has run
    std::unique_ptr<std::fstream> stream_;    // made by open, destroyed by close
    std::FILE* stdio_ = nullptr;              // owned stdio handle, or null
};

}  // namespace lumo::ex

#endif  // KOVPAGER_SUPPORT_KOVFILE_H
