#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// An inode number on the storage root's device.
enum class FileID : std::uint64_t {};
/// A document's lasting number; 0 is none.
enum class DocumentID : std::uint32_t {};

/// What kind of object a record is of. Written to disk: add numbers, never change one.
enum class ObjectKind : std::uint8_t { other = 0, file = 1, folder = 2, package = 3 };

/// An object as it was just seen in the file system.
struct ObjectSighting {
    FileID fileID{};
    std::int64_t birthTime =
        0;  ///< ns since 1970; 0 where the file system has none. With the file ID it is the object's identity.
    FileID parent{};
    ObjectKind kind = ObjectKind::other;
    std::string_view name;  ///< borrowed for the call
    bool wantsDocumentID = false;
    DocumentID documentID{};  ///< out: the document ID it has or was given
};

/// What the store knows of an object.
struct ObjectRecord {
    FileID parent{};
    std::int64_t birthTime = 0;
    ObjectKind kind = ObjectKind::other;
    DocumentID documentID{};
    std::string name;
};

struct DocumentRecord {
    FileID fileID{};
    std::int64_t birthTime = 0;
};

/// How a store works. The host uses the defaults; tests ask for less room and for their own time.
struct VolumeStoreOptions {
    /// Records that are in memory until a checkpoint has written them. Whoever brings more waits for the checkpoint.
    std::size_t unsavedRecordsMax = 131'072;
    /// Address space for the tables. Taken in smaller pieces where the process may not have so much.
    std::size_t mapBytes = sizeof(void*) == 8 ? std::size_t{1} << 36 : std::size_t{1} << 29;
    /// Pages that a checkpoint changes in one transaction, about; so many are in memory until its end.
    std::size_t checkpointPagesMax = 512;
    /// Off: a checkpoint is written by checkpoint() and at the end, never by itself.
    bool checkpointsItself = true;
    /// Called within a checkpoint after each of its transactions, on the thread that writes it.
    std::function<void()> onCheckpointStep;
};

/// The store of what file systems don't keep: which document ID belongs to which object, and where an object was last
/// seen.
///
/// One folder of files (docs/volume-store.md), written by one process at a time. The object records are hints: whoever
/// hands out a path checks it against the file system first. The document table is the truth of its own: an ID once
/// given is never given to another document, also not after a crash or a power cut at any instruction.
///
/// Durable when: what identify() answered survives the death of the process at once, and a power cut after the next
/// checkpoint (at most kCheckpointDelay later); IDs given after the last checkpoint before a power cut are skipped,
/// never given again.
///
/// Thread safety: all operations, from any thread; readers don't wait for writers.
class VolumeStore {
public:
    /// From the first unsaved record to the checkpoint that begins to save it. Without news there is no checkpoint.
    static constexpr std::chrono::milliseconds kCheckpointDelay{1000};

    /// Opens the store in the folder, making both when missing (0700).
    ///
    /// EBUSY with `holder` (a pid as text) in the user info when another process has it open. A damaged store is set
    /// aside (renamed) and a new one with a new UUID is made, with one error line.
    static Result<std::unique_ptr<VolumeStore>> open(const std::string& folder);
    static Result<std::unique_ptr<VolumeStore>> open(const std::string& folder, const VolumeStoreOptions& options);
    /// Writes a checkpoint and lets go of the lock.
    ~VolumeStore();

    /// Made anew when the store is created or found damaged; every older token expires with it.
    KsUUID uuid() const;

    /// Records where objects were seen, in one transaction, and gives a document ID to each that wants one and has
    /// none.
    ///
    /// Costs no write when nothing is new. An object whose birth time differs from the recorded one is another object
    /// under a recycled number: its record, and its document ID, begin anew.
    ///
    /// After an error nothing of the call is recorded and no ID was given. EINVAL for a name that no file can have;
    /// ENOSPC when the disk is full or the last document ID was given.
    Result<void> identify(std::span<ObjectSighting> sightings);

    std::optional<ObjectRecord> object(FileID fileID) const;
    std::optional<DocumentRecord> document(DocumentID documentID) const;

    /// Path of the object below a root, by the recorded parents: names joined with "/", without a leading one. Empty
    /// for the root itself.
    ///
    /// None when a record of the chain is missing, the chain does not end in one of the roots, or it is longer than any
    /// real one. `rootIndex` tells which of `roots` it ended in.
    struct RecordedPath {
        std::string path;
        std::size_t rootIndex = 0;
        std::int64_t birthTime = 0;
    };
    std::optional<RecordedPath> recordedPath(FileID fileID, std::span<const FileID> roots) const;

    /// The volume's event position: the last ID that advanceEventID() gave, 0 in a new store.
    ///
    /// Never goes back, also not over a power cut. After one, or after the process was killed, it goes on beyond every
    /// ID that may have been given.
    std::uint64_t currentEventID() const;
    Result<std::uint64_t> advanceEventID();

    struct Counts {
        std::uint64_t objects = 0;
        std::uint64_t documents = 0;
    };
    Counts counts() const;

    /// Transactions written since the store was opened. For tests of what a listing costs.
    std::uint64_t transactionCount() const;
    /// Makes everything durable now.
    Result<void> checkpoint();

    VolumeStore(const VolumeStore&) = delete;
    VolumeStore& operator=(const VolumeStore&) = delete;

private:
    VolumeStore();
    class Implementation;
    std::unique_ptr<Implementation> implementation_;
};

}  // namespace cindral
