#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/revisions/NameHash.h"
#include "platform/revisions/NumberSource.h"
#include "platform/revisions/ObjectTables.h"
#include "platform/revisions/Overlay.h"
#include "platform/revisions/StoreLock.h"
#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeLog.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// The parts of a store and the way of a record through them: log and overlay at once, tables with the next checkpoint.
///
/// There are two log files, each with an overlay of what it holds. One pair takes what is new; the other, once
/// frozen, is
/// written to the tables and emptied.
///
/// Locks are taken in the order checkpointMutex_, writerMutex_, mutex_.
class VolumeStore::Implementation {
public:
    Implementation(std::string folder, VolumeStoreOptions options);
    ~Implementation();

    Result<void> open();

    KsUUID uuid() const;
    Result<void> identify(std::span<ObjectSighting> sightings);
    std::optional<ObjectRecord> object(FileID fileID) const;
    std::optional<DocumentRecord> document(DocumentID documentID) const;
    std::optional<RecordedPath> recordedPath(FileID fileID, std::span<const FileID> roots) const;
    Counts counts() const;
    Result<void> checkpoint();

    std::uint64_t currentEventID() const { return numbers_->currentEvent(); }
    Result<std::uint64_t> advanceEventID();

    Result<std::uint64_t> apply(const IndexChanges& changes, std::span<const FileID> roots);
    bool indexed(FileID fileID, const ObjectReceiver& receive) const;
    Result<void> indexed(std::span<const FileID> fileIDs,
                         const std::function<void(std::size_t, const IndexedObject*)>& receive) const;
    bool childrenNamed(FileID parent, std::string_view name, const ObjectReceiver& receive) const;
    Result<void> children(FileID parent, const ObjectReceiver& receive) const;
    std::uint64_t childCount(FileID parent) const;
    std::vector<Name> otherNames(FileID fileID) const;
    Bytes attributes(DocumentID document) const;
    Result<void> rememberAttributes(DocumentID document, ByteView attributes);
    Result<std::vector<JournalEvent>> events(std::uint64_t after, std::size_t max) const;
    Result<std::vector<JournalEvent>> documentEvents(std::uint64_t after, std::size_t max) const;
    std::optional<std::uint64_t> historyBegin() const;
    std::optional<std::chrono::system_clock::time_point> oldestEventTime() const;
    Result<std::uint64_t> beginHistory();
    Result<void> renewUUID();
    Result<void> trimJournal(std::uint64_t eventsMax, std::chrono::seconds ageMax);

    std::optional<KsError> failure() const {
        const MutexLock lock(mutex_);
        return lastFailure_;
    }
    const std::string& replacement() const { return replacement_; }
    static Result<std::vector<std::string>> setAsideWhatStops(const std::string& folder);

    std::uint64_t transactionCount() const { return transactionCount_.load(std::memory_order_relaxed); }

private:
    // Opening.
    std::string pathOf(const char* name) const { return folder_ + "/" + name; }
    bool hasTables() const;
    Result<void> openTables(const std::optional<HighWaterMarks>& marks);
    Result<void> createTables(const std::optional<HighWaterMarks>& marks);
    Result<void> checkTables();
    Result<void> setAside(const KsError& damage);
    Result<HighWaterMarks> openState(const std::optional<HighWaterMarks>& marks);
    struct Replayed;
    Result<void> readLogs(Replayed& replayed);
    void replay(const volumelog::Batch& batch, Overlay& unsaved) const;
    Result<void> saveReplayed(const Replayed& replayed, const HighWaterMarks& next);
    Result<std::string> closedNote() const;
    void close();
    Result<void> saveHead();

    // Looking up.
    /// The result, remembered where it tells of damage.
    template <typename T>
    Result<T> noticed(Result<T> result) const {
        if (!result.ok() && result.error().isPosix(kDamageCode)) isSuspect_ = true;
        return result;
    }
    class Reader;
    Overlay::State findUnsaved(FileID fileID) const REQUIRES(mutex_);
    template <typename FileIDAt, typename Use>
    Result<void> lookUp(std::size_t count, FileIDAt fileIDAt, Use use) const;
    struct FoundChild;
    class FoundChildren;
    void findUnsavedChildren(FileID parent, std::string_view name, std::uint32_t hash, FoundChildren& found) const;
    void findSavedChildren(FileID parent, std::string_view name, std::uint32_t hash, FoundChildren& found) const;
    void findByOtherName(FileID parent, std::string_view name, std::uint32_t hash, FoundChildren& found) const;
    std::vector<NameKey> namesWithHash(FileID parent, std::uint32_t hash) const;
    std::optional<std::string> nameOf(const NameKey& key) const;
    using Names = std::map<NameKey, std::string>;
    Names names(FileID fileID) const;

    // The journal.
    Result<std::uint64_t> resolve(std::vector<JournalEvent>& candidates, std::vector<JournalEvent>& found) const;
    Result<bool> readEvents(std::uint64_t& after, std::size_t max, std::vector<JournalEvent>& found) const;
    Result<bool> hasEvents() const REQUIRES(writerMutex_);
    Result<std::uint64_t> beginFirstHistory() REQUIRES(writerMutex_);
    std::int64_t now() const;
    Result<std::uint64_t> lastEventOlderThan(std::chrono::seconds age, std::uint64_t current) const;

    // Recording.
    class Update;
    Result<void> record(std::span<ObjectSighting> sightings, const std::vector<std::uint32_t>& news);
    Update beginUpdate(std::span<const FileID> roots, bool journals) REQUIRES(writerMutex_);
    Result<void> commit(Update& update) REQUIRES(writerMutex_);
    Result<void> appendBatch() REQUIRES(writerMutex_);
    void saveSoon() REQUIRES(mutex_);
    bool isTimeMarkDue(std::int64_t time) const REQUIRES(writerMutex_);
    Result<void> waitForRoom() REQUIRES(writerMutex_);
    bool isFull() const REQUIRES(mutex_);
    void freeze() REQUIRES(writerMutex_, mutex_);

    // Checkpoints.
    Result<void> writeCheckpoint() EXCLUDES(checkpointMutex_);
    TablesHead headFor(const Overlay& overlay, std::uint64_t lastBatch, const HighWaterMarks& marks) const
        REQUIRES(checkpointMutex_);
    Result<void> writeTables(const std::shared_ptr<const Overlay>& overlay, std::uint64_t lastBatch)
        REQUIRES(checkpointMutex_);
    void publishChildCounts(const Overlay& overlay);
    void checkpointSucceeded(std::uint64_t lastBatch) REQUIRES(writerMutex_);
    void checkpointFailed(const KsError& error) REQUIRES(writerMutex_);
    Result<void> saveEverything() REQUIRES(checkpointMutex_, writerMutex_);
    void writeCheckpointsWhenDue();
    bool waitUntilDue();
    std::optional<std::chrono::steady_clock::time_point> nextCheckpoint() const REQUIRES(mutex_);

    // Constant after open.
    const std::string folder_;
    const VolumeStoreOptions options_;
    UniqueFd folderFd_;
    StoreLock lock_;
    std::unique_ptr<NumberSource> numbers_;
    std::unique_ptr<ObjectTables> tables_;
    NameHashKey nameHashKey_{};
    bool opened_ = false;
    std::thread checkpointThread_;

    std::string replacement_;  // Constant once the store is open.
    std::atomic<std::uint64_t> transactionCount_{0};
    mutable std::atomic<bool> isSuspect_{
        false};  // Damage was met while the store was in use: the next opening looks at everything.

    /// Held while a checkpoint is written.
    Mutex checkpointMutex_;

    /// Held by whoever appends to the log; nobody else changes the overlays, or which is which.
    Mutex writerMutex_;
    Condition roomChanged_;
    BatchWriter batch_ GUARDED_BY(writerMutex_);
    std::array<LogFile, 2> logs_ GUARDED_BY(writerMutex_);
    std::size_t activeLog_ GUARDED_BY(writerMutex_) = 0;
    std::uint64_t nextBatch_ GUARDED_BY(writerMutex_) = 1;
    std::vector<FileID> roots_ GUARDED_BY(writerMutex_);  // Of the last apply().
    struct TimeMark {
        std::uint64_t eventID = 0;
        std::int64_t time = 0;
    };
    std::optional<TimeMark> lastTimeMark_ GUARDED_BY(writerMutex_);

    /// Held for moments only, never over a system call that may wait for the disk.
    mutable Mutex mutex_;
    Condition dueChanged_;
    std::shared_ptr<Overlay> active_ GUARDED_BY(mutex_) = std::make_shared<Overlay>();
    std::shared_ptr<const Overlay> frozen_ GUARDED_BY(mutex_);  // Null when everything before active_ is in the tables.
    std::uint64_t frozenLastBatch_ GUARDED_BY(mutex_) = 0;
    std::uint64_t savedBatch_ GUARDED_BY(mutex_) = 0;
    std::uint64_t frozenCountSaved_ GUARDED_BY(mutex_) =
        0;  // A snapshot taken before it grew may lack what left the overlay.
    // How many children the folders that frozen_ changes have with it. None before it begins to be written: until then
    // the tables and its differences tell.
    using ChildCounts = std::unordered_map<FileID, std::uint64_t>;
    std::shared_ptr<const ChildCounts> frozenChildCounts_ GUARDED_BY(mutex_);
    KsUUID uuid_ GUARDED_BY(mutex_);
    bool hasHistory_ GUARDED_BY(mutex_) = false;
    std::uint64_t forgottenEvent_ GUARDED_BY(mutex_) = 0;  // No event up to it is there any more.
    Counts counts_ GUARDED_BY(mutex_);
    std::optional<std::chrono::steady_clock::time_point> due_ GUARDED_BY(mutex_);  // Of active_.
    std::chrono::steady_clock::time_point retryAt_ GUARDED_BY(mutex_);             // Of frozen_.
    std::optional<KsError> lastFailure_ GUARDED_BY(mutex_);
    std::uint64_t failures_ GUARDED_BY(mutex_) = 0;
    bool stopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
