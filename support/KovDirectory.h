// KovDirectory: a directory path with a cached listing, created with its
// missing parents, removed with everything in it, copied as a tree.
//
//   lumo::ex::KovDirectory dir("/var/tmp/kov", 1, false);
//   if (!dir.exists()) dir.create();
//   std::string native = dir.path(2);   // "/var/tmp/kov"
//
// exists() is true only for an existing directory: the status read marks
// the record as a directory, so a regular file of that name counts as
// missing. The listing is cached and read again only when the directory's
// modification time is not earlier than the time of the last listing (the
// same second included), so a change made in the second of the listing is
// never missed. A listing never holds "." or "..".
//
// Patterns of entries()/contains() are ECMAScript regular expressions that
// match anywhere in a name ("\\.dat$", "^a").
//
// Failures are reported as false, never by an exception. No lock; one
// thread at a time.
#ifndef KOVPAGER_SUPPORT_KOVDIRECTORY_H
#define KOVPAGER_SUPPORT_KOVDIRECTORY_H

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "support/KovFile.h"

namespace lumo::ex {

class KovDirectory : public KovFile {
  public:
    // From a narrow path (host text). See KovFile for the two options.
    KovDirectory(const std::string& path, std::int32_t caseMode = 0, bool presumedExisting = false);
    // On an existing path record (may be null).
    explicit KovDirectory(std::shared_ptr<FileInfo> info);
    // On the record of `file`, with an empty listing.
    explicit KovDirectory(const KovFile& file);
    KovDirectory(const KovDirectory& other);
    KovDirectory& operator=(const KovDirectory& other);
    ~KovDirectory() override;

    // The root kind of the first record of the path chain: 1 a lone separator
    // (or the network prefix), 3 a drive "X:", 2 ".", 0 otherwise.
    int rootKind() override;
    // Creates the directory, and first its missing parents (outermost first).
    bool create() override;
    // Removes the directory and everything in it. Refused (false), with
    // nothing touched, for the first record of its path chain: a root ("/",
    // "\", "C:"), the "." heading a relative path, and the one name of a
    // relative path ("foo", or "C:foo" on Windows). A symbolic link (or
    // junction) is taken away by itself. Single failures do not stop the
    // walk; the result is whether the directory itself went. A directory
    // that cannot be listed is removed when it is empty.
    bool remove() override;
    bool copyTo(const std::string& destination, bool overwrite) override;
    // Copies the tree: creates the destination, then copies every entry.
    // Refused for a destination inside this directory.
    bool copyTo(const kov::text::Utf8Text& destination, bool overwrite) override;
    // As KovFile, then marks the record as a directory.
    bool refresh(bool force) override;

    // True when the listing holds an entry named `name` (ignoring case unless
    // the case mode is 0).
    virtual bool contains(const kov::text::Utf8Text& name);
    // Appends the entries whose names match `pattern` (".*" is everything).
    // False when the directory is missing or the pattern does not compile.
    virtual bool entries(std::vector<KovFile>& out, const std::string& pattern);
    // Appends all entries; false when the directory is missing. A directory
    // that cannot be listed gives no entries (true).
    virtual bool entries(std::vector<KovFile>& out);
    // Reads the listing again when it is stale; false when the directory is
    // missing. A directory that cannot be listed gives true and an empty
    // listing (or the names read before the listing failed).
    virtual bool readEntries();

  private:
    std::vector<KovFile> listing_;  // the cached listing
    std::int64_t listingTime_ = 0;  // when it was read, seconds since the epoch
};

}  // namespace lumo::ex

#endif  // KOVPAGER_SUPPORT_KOVDIRECTORY_H
