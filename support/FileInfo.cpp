#include "support/FileInfo.h"

#include <vector>

#include "support/FileSystem.h"
#include "support/NativePath.h"

namespace lumo::ex {

using kov::path::PathStyle;

std::string FileInfo::fullPath() const {
    const PathStyle style = kov::fs::fileSystem().style();
    std::vector<const FileInfo*> chain;
    for (const FileInfo* r = this; r != nullptr; r = r->parent_.get())
        chain.push_back(r);
    std::string out;
    for (auto it = chain.rbegin(); it != chain.rend(); ++it) {
        out = kov::path::joinComponent(out, (*it)->name_.bytes(), style);
    }
    return out;
}

void FileInfo::setKind(std::int32_t kind) {
    // An unknown stored kind says nothing against the new one; a known,
    // different kind means the path is not what the caller looks for. So a
    // record presumed to exist, and the network prefix, are believed by
    // directory objects until a forced read; on Windows a temporary-directory
    // value of exactly two backslashes is therefore chosen and published as
    // an empty text.
    if (kind_ != kUnknown && kind != kind_)
        exists_ = 0;
    kind_ = kind;
}

std::shared_ptr<FileInfo> FileInfo::fromPath(const std::string& path, std::int32_t caseMode,
                                             bool presumedExisting) {
    const PathStyle style = kov::fs::fileSystem().style();
    const std::vector<std::string> parts =
        kov::path::splitNative(kov::path::nativeForm(path, style), style);
    std::shared_ptr<FileInfo> current;
    for (std::size_t i = 0; i < parts.size(); ++i) {
        auto record = std::make_shared<FileInfo>();
        record->name_ = kov::text::Utf8Text(parts[i]);
        record->parent_ = current;
        record->caseMode_ = caseMode;
        if (presumedExisting) {
            record->statusRead_ = 1;
            record->exists_ = 1;
        }
        if (i == 0 && kov::path::isPresumedRoot(parts[i], style)) {
            record->statusRead_ = 1;
            record->exists_ = 1;
            // The network prefix names no directory of its own.
            record->kind_ = parts[i] == "\\\\" ? kUnknown : kDirectory;
        }
        current = std::move(record);
    }
    return current;
}

}  // namespace lumo::ex
