#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

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
    /// Puts another manager in the default's place; null brings the default back. For tests; the manager outlives its
    /// use.
    static void replaceDefaultManager(RvStorageManager* manager);

    virtual ~RvStorageManager() = default;

    /// Connects the manager, and the URLs' document identifiers, to a store; null disconnects.
    void setStore(std::shared_ptr<VolumeStore> store);
    std::shared_ptr<VolumeStore> store() const;

    /// Brings the store's records up to date with what others did to the tree; answers whether they then hold every
    /// object. Asked when the records don't lead to an object.
    using CatchUp = std::function<bool()>;
    /// Empty: the records are only what listings saw, and the file system itself is searched.
    void setCatchUp(CatchUp catchUp);

    /// The file ID of the document on the device, checked against the file system; 0 with errno otherwise:
    /// ENOENT no such document, or its file is gone; ESTALE it moved while it was looked for, ask again; EAGAIN no
    /// store is connected yet; EXDEV another device than the storage's; EINVAL no document number.
    virtual std::uint64_t resolveDocumentID(std::int64_t documentID, std::uint32_t device);

    /// The document ID of the open file (O_PATH will do), given now if it has none; 0 with errno otherwise.
    virtual std::uint32_t documentIDForDescriptor(int fd);

    enum class AllocateIfNone { no, yes };
    /// The document ID of the file or package at the URL, as recorded for the object that the URL knows or finds there,
    /// given now if it has none and one is to be allocated. Costs no system call where the URL's status is known and the
    /// record is up to date. ENOENT where it has none, POSIX errors otherwise.
    virtual Result<std::uint32_t> permanentStorageForItem(const KsURL& url, AllocateIfNone allocate);

    /// Gives entries of open folders (KsURL::child) their document IDs, and records where they were seen, in one
    /// transaction.
    ///
    /// The URLs' cached document identifiers are set. Entries that are gone are left as they are. An object with several
    /// names is one item under the name it was first seen by, for as long as that leads to it: its other names are taken
    /// out of `entries`.
    Result<void> identify(std::vector<KsURL>& entries);

    /// The path of an object by its number, as presented: by the recorded parents, or, where they don't lead to it, by
    /// asking the file system. What is handed out was checked against the file system.
    ///
    /// POSIX errors: ENOENT when nothing below the roots has the number, ESTALE when it moved while it was looked for,
    /// ENAMETOOLONG when the path does not fit `sizeMax` bytes with its NUL.
    Result<std::string> pathOfFileID(std::uint64_t fileID, std::uint32_t device, std::size_t sizeMax);

private:
    struct Search;
    /// False when there is nothing that could.
    bool catchUp() const;

    mutable Mutex mutex_;
    std::shared_ptr<VolumeStore> store_ GUARDED_BY(mutex_);
    std::shared_ptr<const CatchUp> catchUp_ GUARDED_BY(mutex_);
};

}  // namespace cindral
