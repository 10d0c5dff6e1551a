// KovDirectory: directory status, creation of a whole chain, recursive
// removal and copy, and the cached listing.
//
// Listing cache: listing_ was read at listingTime_ (seconds). It stands while
// the directory's modification time is strictly earlier than listingTime_;
// a change made in the same second as the listing may not be reflected in
// the cache, so equal times read the directory again.
#include "support/KovDirectory.h"

#include <regex>
#include <utility>

#include "support/FileSystem.h"
#include "support/NativePath.h"

namespace lumo::ex {

using kov::text::Utf8Text;

KovDirectory::KovDirectory(const std::string& path, std::int32_t caseMode, bool presumedExisting)
    : KovFile(Utf8Text(kov::text::narrowToUtf8Lossy(path)), caseMode, presumedExisting) {}

KovDirectory::KovDirectory(std::shared_ptr<FileInfo> info) : KovFile(std::move(info)) {}

KovDirectory::KovDirectory(const KovFile& file) : KovFile(file) {}

KovDirectory::KovDirectory(const KovDirectory& other)
    : KovFile(other), listing_(other.listing_), listingTime_(other.listingTime_) {}

KovDirectory& KovDirectory::operator=(const KovDirectory& other) {
    if (this != &other) {
        KovFile::operator=(other);
        listing_ = other.listing_;
        listingTime_ = other.listingTime_;
    }
    return *this;
}

KovDirectory::~KovDirectory() = default;

int KovDirectory::rootKind() {
    if (!info_)
        return kov::path::kNotRoot;
    const FileInfo* first = info_.get();
    while (first->parent_)
        first = first->parent_.get();
    return kov::path::rootKindOf(first->name_.bytes(), kov::fs::fileSystem().style());
}

bool KovDirectory::refresh(bool force) {
    if (!info_)
        return false;
    KovFile::refresh(force);
    info_->setKind(FileInfo::kDirectory);
    return info_->exists_ != 0;
}

bool KovDirectory::create() {
    if (!info_)
        return false;
    if (exists())
        return true;
    if (std::unique_ptr<KovDirectory> parent = parentDirectory()) {
        if (!parent->create())
            return false;
    }
    if (!kov::fs::fileSystem().makeDirectory(info_->fullPath()))
        return false;
    info_->statusRead_ = 1;
    info_->exists_ = 1;
    info_->kind_ = FileInfo::kDirectory;
    info_->statValid_ = 0;
    caseResolved_ = 1;
    return true;
}

bool KovDirectory::remove() {
    // The first record of its chain is never removed: a root ("/", "\", "C:"), the "." heading
    // a relative path, and the one name of a relative path ("foo", "C:foo") alike.
    if (!info_ || !info_->parent_)
        return false;
    kov::fs::FileSystem& fs = kov::fs::fileSystem();
    const std::string native = info_->fullPath();
    listing_.clear();
    // A link to a directory goes by itself: listing through it would delete the entries of a
    // directory this object does not own.
    if (fs.isLink(native)) {
        const bool removed = fs.removeLink(native);
        refresh(true);
        return removed;
    }
    if (!readEntries())
        return false;
    for (KovFile& entry : listing_)
        entry.remove();
    listing_.clear();
    const bool removed = fs.removeDirectory(native);
    refresh(true);
    return removed;
}

bool KovDirectory::copyTo(const std::string& destination, bool overwrite) {
    return copyTo(Utf8Text(kov::text::narrowToUtf8Lossy(destination)), overwrite);
}

bool KovDirectory::copyTo(const Utf8Text& destination, bool overwrite) {
    if (!info_ || isChainRoot() || !exists())
        return false;
    KovDirectory target(FileInfo::fromPath(destination.bytes(), info_->caseMode_, false));
    if (!target.info_)
        return false;
    const kov::path::PathStyle style = kov::fs::fileSystem().style();
    const std::string source = info_->fullPath();
    const std::string copy = target.info_->fullPath();
    // A copy into the tree itself would never end.
    const std::string inside = kov::path::joinComponent(source, "", style);
    if (copy == source || copy.compare(0, inside.size(), inside) == 0)
        return false;
    if (!target.exists() && !target.create())
        return false;
    if (!readEntries())
        return false;
    const std::vector<KovFile> listed = listing_;
    bool copied = true;
    for (const KovFile& entry : listed) {
        KovFile item(entry);
        const std::string to = kov::path::joinComponent(copy, entry.info()->name_.bytes(), style);
        if (!item.copyTo(Utf8Text(to), overwrite))
            copied = false;
    }
    return copied;
}

bool KovDirectory::contains(const Utf8Text& name) {
    std::vector<KovFile> all;
    if (!info_ || !entries(all, ".*"))
        return false;
    const bool exact = info_->caseMode_ == 0;
    for (const KovFile& entry : all) {
        const std::string& entryName = entry.info()->name_.bytes();
        if (exact ? entryName == name.bytes()
                  : kov::text::equalsIgnoringCase(entryName, name.bytes())) {
            return true;
        }
    }
    return false;
}

bool KovDirectory::entries(std::vector<KovFile>& out, const std::string& pattern) {
    if (pattern == ".*")
        return entries(out);
    if (!info_ || !refresh(false))
        return false;
    std::regex expression;
    try {
        expression = std::regex(pattern, std::regex::ECMAScript);
    } catch (const std::regex_error&) {
        return false;
    }
    std::vector<KovFile> all;
    if (!entries(all))
        return false;
    for (const KovFile& entry : all) {
        if (std::regex_search(entry.info()->name_.bytes(), expression))
            out.push_back(entry);
    }
    return true;
}

bool KovDirectory::entries(std::vector<KovFile>& out) {
    if (!readEntries())
        return false;
    out.insert(out.end(), listing_.begin(), listing_.end());
    return true;
}

bool KovDirectory::readEntries() {
    if (!info_ || !exists())
        return false;
    if (!refresh(true))
        return false;
    // Entries listed under a record this object no longer names (after a
    // move) are never kept.
    const bool cacheOurs = !listing_.empty() && listing_.front().info()->parent_ == info_;
    if (cacheOurs && info_->modificationTime_ < listingTime_)
        return true;
    kov::fs::FileSystem& fs = kov::fs::fileSystem();
    listingTime_ = fs.now();
    listing_.clear();
    // A directory that cannot be listed (one that may be entered and changed but not read, mode
    // 0300) still gives true, with the names read before the failure: none when it could not be
    // opened. So such an empty directory is removed by remove().
    std::vector<kov::fs::Entry> names;
    static_cast<void>(fs.list(info_->fullPath(), names));
    listing_.reserve(names.size());
    for (const kov::fs::Entry& e : names) {
        listing_.emplace_back(*this, Utf8Text(e.name), 1,
                              e.directory ? FileInfo::kDirectory : FileInfo::kFile);
    }
    return true;
}

}  // namespace lumo::ex
