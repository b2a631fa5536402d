#pragma once

#include <cstdint>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// One of the store's own small files (mode 0600), open for reading and writing. Never a link.
///
/// Thread safety: the caller's.
class StoreFile {
public:
    StoreFile() = default;
    /// Makes the file when it is missing.
    static Result<StoreFile> open(int folder, const char* name);

    int descriptor() const { return fd_.get(); }
    Result<std::uint64_t> size() const;
    Result<Bytes> readAll() const;
    /// All of it or an error; after an error some of it may have been written.
    Result<void> writeAt(std::uint64_t offset, ByteView bytes);
    Result<void> truncate(std::uint64_t size);
    /// On the disk when it returns.
    Result<void> sync();

private:
    explicit StoreFile(UniqueFd fd) : fd_(std::move(fd)) {}
    UniqueFd fd_;
};

/// Puts the folder's list of names on the disk.
Result<void> syncFolder(int folder);
Result<void> syncFolderOf(const std::string& path);
/// Makes the folder and those above it that are missing, 0700, on the disk.
Result<void> makeFolders(const std::string& path);

}  // namespace cindral
