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

#include "platform/foundation/Data.h"
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
    /// By the index alone: where that has no such object any more, nothing is recorded and no ID is given.
    bool isByIndex = false;
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
    friend bool operator==(const DocumentRecord&, const DocumentRecord&) = default;
};

// VolumeIndex.h
struct IndexedObject;
struct JournalEvent;
class IndexChanges;

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
    /// The time that the journal goes by. None: the system's.
    std::function<std::chrono::system_clock::time_point()> now;
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
        bool isOpen = true;  ///< the object, and all above it to the root, are folders that could be read
    };
    std::optional<RecordedPath> recordedPath(FileID fileID, std::span<const FileID> roots) const;

    /// The volume's event position: the last ID that advanceEventID() gave, 0 in a new store.
    ///
    /// Never goes back, also not over a power cut. After one, or after the process was killed, it goes on beyond every
    /// ID that may have been given.
    std::uint64_t currentEventID() const;
    Result<std::uint64_t> advanceEventID();

    // The directory index and the event journal. One thread at a time changes them: the recorder's.

    /// Carries the changes out, and journals what they mean, in one transaction: durable like identify(). Answers the
    /// last event's ID.
    ///
    /// An object that nobody was given an identifier of departs without an event, and its own event goes with it: an
    /// object that came and went leaves nothing behind. `roots` are where paths begin.
    ///
    /// After an error nothing of the call is recorded.
    Result<std::uint64_t> apply(const IndexChanges& changes, std::span<const FileID> roots);

    /// Called with an object's name borrowed for the call. May read the store, but not change it.
    using ObjectReceiver = std::function<void(const IndexedObject&)>;
    /// Calls back and answers true, or answers false when the object is unknown.
    bool indexed(FileID fileID, const ObjectReceiver& receive) const;
    /// Many at once, several times faster: calls back with the place of each file ID, and null for one that is unknown.
    Result<void> indexed(std::span<const FileID> fileIDs,
                         const std::function<void(std::size_t, const IndexedObject*)>& receive) const;
    /// Each object that is recorded under the name, also where that is one of its other names. While one takes the place
    /// of another, there are two. False when there is none.
    bool childrenNamed(FileID parent, std::string_view name, const ObjectReceiver& receive) const;
    /// Every object whose recorded place is in the folder, in no order. What changes meanwhile is told or not.
    Result<void> children(FileID parent, const ObjectReceiver& receive) const;
    std::uint64_t childCount(FileID parent) const;
    /// The names of an object beside its recorded one.
    struct Name {
        FileID parent{};
        std::string name;
    };
    std::vector<Name> otherNames(FileID fileID) const;

    /// The attributes that a document had when they were last looked at, as given to rememberAttributes(): bytes that
    /// the store doesn't read. Empty for none. What is remembered for document 0 and for the last number is of the volume
    /// itself.
    Bytes attributes(DocumentID document) const;
    Result<void> rememberAttributes(DocumentID document, ByteView attributes);

    /// Events of objects (`present` and `departed`) with an ID above `after`, oldest first, at most `max`.
    Result<std::vector<JournalEvent>> events(std::uint64_t after, std::size_t max) const;
    /// Events of documents, the same way.
    Result<std::vector<JournalEvent>> documentEvents(std::uint64_t after, std::size_t max) const;

    /// The smallest ID after which every event is still there; none before beginHistory().
    std::optional<std::uint64_t> historyBegin() const;
    /// About when the oldest event that is kept was journalled: at most ten minutes too early. None for no events.
    std::optional<std::chrono::system_clock::time_point> oldestEventTime() const;
    /// Says that the index is complete: from the ID that it answers on, what happens is journalled. Forgets older
    /// events: where there are any, that is on the disk when this returns.
    Result<std::uint64_t> beginHistory();
    /// Takes a new UUID, and forgets the events: every token of before expires.
    Result<void> renewUUID();
    /// Forgets the oldest events beyond the count, and those that were journalled longer ago than the age, which is
    /// known to ten minutes: none is forgotten too early.
    Result<void> trimJournal(std::uint64_t eventsMax, std::chrono::seconds ageMax);

    struct Counts {
        std::uint64_t objects = 0;
        std::uint64_t documents = 0;
        std::uint64_t events = 0;  ///< in the journal
    };
    Counts counts() const;

    /// Why what is new is in memory and in the logs alone at present; none where all is as it should be.
    std::optional<KsError> failure() const;
    /// What was wrong with the store that this one took the place of when it was opened, and where that was put; empty
    /// where there was none.
    const std::string& replacement() const;
    /// Before a store is opened: renames what is not of the kind that a store is made of, such as a folder where a file
    /// is to be, beside itself. Answers the new paths. What a store could open is left alone.
    static Result<std::vector<std::string>> setAsideWhatStops(const std::string& folder);

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
