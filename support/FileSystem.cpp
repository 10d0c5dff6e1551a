// The replaceable platform instance.
#include "support/FileSystem.h"

namespace kov::fs {
namespace {

FileSystem* replacement = nullptr;  // set by tests only

}  // namespace

FileSystem& fileSystem() {
    return replacement != nullptr ? *replacement : hostFileSystem();
}

FileSystem* TEST_setFileSystem(FileSystem* newInstance) {
    FileSystem* previous = &fileSystem();
    replacement = newInstance;
    return previous;
}

}  // namespace kov::fs
