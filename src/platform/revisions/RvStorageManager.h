#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// The generational document store: which file a document ID stands for, and a document ID for an open file.
///
/// Thread safety: all operations, from any thread. errno is the caller's thread's.
class RvStorageManager {
public:
    static RvStorageManager& defaultManager();

    /// Connects the manager, and the URLs' document identifiers, to a store; null disconnects. The store outlives its connection.
    void setStore(std::shared_ptr<VolumeStore> store);
    std::shared_ptr<VolumeStore> store() const;

    /// The file ID of the document on the device, checked against the file system; 0 with errno otherwise:
    /// ENOENT no such document, or its file is gone; ESTALE what was recorded of the document does not hold, ask again; EAGAIN no store
    /// is connected yet; EBUSY the store can't be read now; EXDEV another device than the storage's; EINVAL no document number.
    std::uint64_t resolveDocumentID(std::int64_t documentID, std::uint32_t device);

    /// The document ID of the open file, given now if it has none; 0 with errno otherwise.
    std::uint32_t documentIDForDescriptor(int fd);

    /// Gives the URLs of a page of a listing their document IDs, and records where they were seen, in one transaction.
    /// The URLs' cached document identifiers are set. URLs whose object is gone are left as they are.
    Result<void> identify(std::span<KsURL> urls, const KsURL& parent);

    /// The path of an object by its number: recorded parents, checked against the file system; the file system asked directly where
    /// they don't lead to it. At most 1,023 bytes, as the platform's call has it. POSIX errors; ENOENT when nothing has the number.
    Result<std::string> pathOfFileID(std::uint64_t fileID, std::uint32_t device);

private:
    mutable Mutex mutex_;
    std::shared_ptr<VolumeStore> store_ GUARDED_BY(mutex_);
};

}  // namespace cindral
