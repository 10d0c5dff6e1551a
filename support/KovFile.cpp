// KovFile. Every platform call goes through kov::fs::fileSystem() with the
// native form of the path; the status read into the shared record is kept
// until a forced refresh or an operation that changes the file.
#include "support/KovFile.h"

#include <utility>
#include <vector>

#include "support/FileSystem.h"
#include "support/KovDirectory.h"
#include "support/NativePath.h"

namespace lumo::ex {

using kov::text::Utf8Text;

namespace {

kov::path::PathStyle currentStyle() {
    return kov::fs::fileSystem().style();
}

bool startsWithTwoSeparators(const std::string& native, kov::path::PathStyle style) {
    const char sep = kov::path::separator(style);
    return native.size() >= 2 && native[0] == sep && native[1] == sep;
}

}  // namespace

KovFile::KovFile(const Utf8Text& path, std::int32_t caseMode, bool presumedExisting)
    : info_(FileInfo::fromPath(path.bytes(), caseMode, presumedExisting)) {}

KovFile::KovFile(std::shared_ptr<FileInfo> info) : info_(std::move(info)) {}

KovFile::KovFile(const KovFile& other) : info_(other.info_), caseResolved_(other.caseResolved_) {}

KovFile::KovFile(const KovDirectory& parent, const Utf8Text& name, int option, std::int32_t kind) {
    auto record = std::make_shared<FileInfo>();
    record->name_ = name;
    record->parent_ = parent.info();
    record->caseMode_ = parent.info() ? parent.info()->caseMode_ : 0;
    if (option == 1) {
        record->statusRead_ = 1;
        record->exists_ = 1;
        record->kind_ = kind;
    }
    info_ = std::move(record);
}

KovFile& KovFile::operator=(const KovFile& other) {
    if (this != &other) {
        close();
        info_ = other.info_;
        caseResolved_ = other.caseResolved_;
    }
    return *this;
}

KovFile::~KovFile() {
    close();
}

bool KovFile::exists() {
    if (!info_)
        return false;
    refresh(false);
    resolveCase();
    return info_->exists_ != 0;
}

Utf8Text KovFile::pathText(int style) const {
    if (!info_)
        return Utf8Text();
    std::string native = info_->fullPath();
    if (style == 2)
        return Utf8Text(std::move(native));
    return Utf8Text(kov::path::portableForm(native, currentStyle()));
}

std::string KovFile::path(int style) const {
    return kov::text::utf8ToNarrowLossy(pathText(style).bytes());
}

Utf8Text KovFile::name() const {
    return info_ ? info_->name_ : Utf8Text();
}

void KovFile::resolveCase() {
    if (caseResolved_ || !info_)
        return;
    caseResolved_ = 1;
    if (info_->caseMode_ == 1)
        return;
    refresh(false);
    if (info_->exists_)
        return;
    // Only a parent record is listed: the one name of a relative path has none, and stops here.
    if (!info_->parent_)
        return;
    KovDirectory parent(info_->parent_);
    if (!parent.exists())
        return;
    std::vector<KovFile> listed;
    if (!parent.entries(listed, ".*"))
        return;
    for (const KovFile& entry : listed) {
        const FileInfo& e = *entry.info();
        if (kov::text::equalsIgnoringCase(e.name_.bytes(), info_->name_.bytes()) &&
            (info_->kind_ == FileInfo::kUnknown || e.kind_ == info_->kind_)) {
            info_->name_ = e.name_;
            refresh(true);
            return;
        }
    }
}

int KovFile::rootKind() {
    KovDirectory asDirectory(info_);
    return asDirectory.rootKind();
}

bool KovFile::ensureStat() {
    if (!info_)
        return false;
    if (!info_->statValid_)
        refresh(true);
    return info_->statValid_ != 0;
}

std::int64_t KovFile::size() {
    return ensureStat() ? info_->size_ : 0;
}

std::int64_t KovFile::modificationTime() {
    return ensureStat() ? info_->modificationTime_ : 0;
}

std::int64_t KovFile::accessTime() {
    return ensureStat() ? info_->accessTime_ : 0;
}

std::int64_t KovFile::creationTime() {
    return ensureStat() ? info_->creationTime_ : 0;
}

std::uint32_t KovFile::device() {
    return ensureStat() ? info_->device_ : 0;
}

std::int32_t KovFile::kind() {
    if (!info_)
        return FileInfo::kUnknown;
    if (info_->kind_ == FileInfo::kUnknown)
        refresh(false);
    return info_->kind_;
}

bool KovFile::refresh(bool force) {
    if (!info_)
        return false;
    if (!force && info_->statusRead_)
        return info_->exists_ != 0;
    info_->statusRead_ = 1;
    const kov::path::PathStyle style = currentStyle();
    std::string native = info_->fullPath();
    // A bare drive is asked as its root directory ("C:" names the current
    // directory of that drive).
    if (style == kov::path::PathStyle::Windows && kov::path::isDriveName(native))
        native += '\\';
    kov::fs::FileSystem& fs = kov::fs::fileSystem();
    kov::fs::Status st;
    if (!native.empty() && fs.status(native, st)) {
        info_->mode_ = st.mode;
        info_->size_ = st.size;
        info_->modificationTime_ = st.modificationTime;
        info_->accessTime_ = st.accessTime;
        info_->creationTime_ = st.creationTime;
        info_->device_ = st.device;
        info_->statValid_ = 1;
        info_->exists_ = 1;
        info_->kind_ = st.directory ? FileInfo::kDirectory : FileInfo::kFile;
        return true;
    }
    info_->exists_ = 0;
    info_->kind_ = FileInfo::kUnknown;
    info_->statValid_ = 0;
    // A network share root is refused by the status call but is a directory.
    if (startsWithTwoSeparators(native, style) && fs.shareIsDirectory(native)) {
        info_->exists_ = 1;
        info_->kind_ = FileInfo::kDirectory;
    }
    return info_->exists_ != 0;
}

std::unique_ptr<KovDirectory> KovFile::parentDirectory() const {
    if (!info_)
        return nullptr;
    if (info_->parent_)
        return std::make_unique<KovDirectory>(info_->parent_);
    if (kov::path::rootKindOf(info_->name_.bytes(), currentStyle()) != kov::path::kNotRoot)
        return nullptr;
    // The first component of a relative path lives in the current directory.
    return std::make_unique<KovDirectory>(FileInfo::fromPath(".", info_->caseMode_, false));
}

bool KovFile::isChainRoot() const {
    return info_ && !info_->parent_ &&
           kov::path::rootKindOf(info_->name_.bytes(), currentStyle()) != kov::path::kNotRoot;
}

bool KovFile::create() {
    if (!info_)
        return false;
    // An existing path is enough, a directory of that name included (its kind is 2 and it
    // exists): nothing is touched.
    if (exists())
        return true;
    // A path without a parent record (a root, or the one name of a relative path such as "bar")
    // cannot be created.
    if (!info_->parent_)
        return false;
    KovDirectory parent(info_->parent_);
    if (!parent.create())
        return false;
    std::fstream out;
    // Append mode creates the file and never truncates one made meanwhile.
    kov::fs::fileSystem().openStream(out, info_->fullPath(),
                                     std::ios_base::out | std::ios_base::app);
    if (!out.is_open() || !out.good())
        return false;
    out.close();
    if (out.fail())
        return false;
    info_->statusRead_ = 1;
    info_->exists_ = 1;
    info_->kind_ = FileInfo::kFile;
    info_->statValid_ = 0;
    caseResolved_ = 1;
    return true;
}

bool KovFile::remove() {
    if (!info_ || !exists())
        return true;
    if (kind() == FileInfo::kDirectory) {
        // Deliberately ignored: a file object reports success for a directory.
        KovDirectory asDirectory(info_);
        asDirectory.remove();
    } else if (!kov::fs::fileSystem().removeFile(info_->fullPath())) {
        return false;
    }
    info_->statusRead_ = 0;
    info_->exists_ = 0;
    info_->kind_ = FileInfo::kUnknown;
    // The file is gone: size and times are read again rather than answered from the old status.
    info_->statValid_ = 0;
    return true;
}

bool KovFile::copyTo(const std::string& destination, bool overwrite) {
    return copyTo(Utf8Text(kov::text::narrowToUtf8Lossy(destination)), overwrite);
}

namespace {

// Whether a copy or a move may write `target`: it names a path, and that path is missing or may
// be overwritten.
bool mayBeWritten(KovFile& target, bool overwrite) {
    if (!target.info())
        return false;
    target.refresh(false);
    return overwrite || !target.info()->exists_;
}

}  // namespace

bool KovFile::copyTo(const Utf8Text& destination, bool overwrite) {
    if (!exists())
        return false;
    if (kind() == FileInfo::kDirectory) {
        KovDirectory asDirectory(info_);
        return asDirectory.copyTo(destination, overwrite);
    }
    KovFile target(destination, info_->caseMode_, false);
    if (!mayBeWritten(target, overwrite))
        return false;
    if (std::unique_ptr<KovDirectory> parent = target.parentDirectory())
        parent->create();
    const bool copied =
        kov::fs::fileSystem().copyFile(info_->fullPath(), target.info_->fullPath(), !overwrite);
    target.info_->statusRead_ = 0;
    return copied;
}

bool KovFile::moveTo(const std::string& destination, bool overwrite) {
    return moveTo(Utf8Text(kov::text::narrowToUtf8Lossy(destination)), overwrite);
}

bool KovFile::moveTo(const Utf8Text& destination, bool overwrite) {
    // A root ("/", ".", a drive) is never moved: it cannot be renamed, and the copy-and-delete
    // fallback would copy everything under it and then report success, since removing a root is
    // refused and a file object ignores what a directory removal reports.
    if (isChainRoot() || !exists())
        return false;
    KovFile target(destination, info_->caseMode_, false);
    if (!mayBeWritten(target, overwrite))
        return false;
    if (!ensureStat())
        return false;
    std::unique_ptr<KovDirectory> parent = target.parentDirectory();
    if (parent)
        parent->create();
    // The device the destination would live on: its own, or its directory's. A destination that
    // does not exist yet has no device of its own, and comparing with 0 would turn every move to
    // a new name into a copy and a delete.
    const std::uint32_t targetDevice =
        target.info_->exists_ ? target.device() : (parent ? parent->device() : 0);
    const std::string targetNative = target.info_->fullPath();
    bool moved = false;
    if (targetDevice == info_->device_) {
        moved = kov::fs::fileSystem().moveFile(info_->fullPath(), targetNative);
    }
    if (!moved) {
        if (!copyTo(Utf8Text(targetNative), overwrite))
            return false;
        if (!remove())
            return false;
    }
    // Mark the status of what was moved as unknown, then take its place.
    info_->statusRead_ = 0;
    info_->exists_ = 0;
    info_->statValid_ = 0;
    info_ = target.info_;
    info_->statusRead_ = 0;
    info_->statValid_ = 0;
    info_->kind_ = FileInfo::kUnknown;
    return true;
}

bool KovFile::open(std::ios_base::openmode mode) {
    if (stdio_ != nullptr)
        return false;
    if (!stream_)
        stream_ = std::make_unique<std::fstream>();
    if (stream_->is_open())
        return true;
    if (!info_)
        return false;
    if (kind() == FileInfo::kDirectory)
        return false;
    if (mode & (std::ios_base::in | std::ios_base::ate | std::ios_base::app)) {
        if (!exists())
            return false;
    }
    kov::fs::fileSystem().openStream(*stream_, info_->fullPath(), mode);
    // The next status query reads the disk again (the stream may change it).
    info_->statusRead_ = 0;
    info_->statValid_ = 0;
    return stream_->is_open() && stream_->good();
}

bool KovFile::close() {
    bool closed = false;
    if (stdio_ != nullptr) {
        closed = std::fclose(stdio_) == 0;
        stdio_ = nullptr;
    }
    if (stream_) {
        if (stream_->is_open()) {
            stream_->close();
            closed = closed || !stream_->fail();
        }
        stream_.reset();
    }
    return closed;
}

void KovFile::adoptStdio(std::FILE* handle) {
    if (stdio_ != nullptr && stdio_ != handle)
        std::fclose(stdio_);
    stdio_ = handle;
}

}  // namespace lumo::ex
