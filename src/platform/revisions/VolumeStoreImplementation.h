#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/revisions/NumberSource.h"
#include "platform/revisions/ObjectTables.h"
#include "platform/revisions/Overlay.h"
#include "platform/revisions/StoreLock.h"
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

    const KsUUID& uuid() const { return uuid_; }
    Result<void> identify(std::span<ObjectSighting> sightings);
    std::optional<ObjectRecord> object(FileID fileID) const;
    std::optional<DocumentRecord> document(DocumentID documentID) const;
    std::optional<RecordedPath> recordedPath(FileID fileID, std::span<const FileID> roots) const;
    Counts counts() const;
    Result<void> checkpoint();

    NumberSource& numbers() const { return *numbers_; }
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
    Result<void> readLogs(Overlay& unsaved);
    static void replay(const volumelog::Batch& batch, Overlay& unsaved);
    Result<void> saveReplayed(const Overlay& unsaved, const HighWaterMarks& next);
    Result<std::string> closedNote() const;
    void close();
    Result<void> saveMarks();

    // Looking up.
    class Reader;
    std::optional<PackedRecord> findUnsaved(FileID fileID) const REQUIRES(mutex_);
    template <typename FileIDAt, typename Use>
    Result<void> lookUp(std::size_t count, FileIDAt fileIDAt, Use use) const;

    // Recording.
    struct Outcome;
    Result<void> record(std::span<ObjectSighting> sightings, const std::vector<std::uint32_t>& news);
    Result<void> decide(std::span<const ObjectSighting* const> news, std::vector<Outcome>& outcomes)
        REQUIRES(writerMutex_);
    void remember(std::span<const ObjectSighting* const> news, const std::vector<Outcome>& outcomes)
        REQUIRES(writerMutex_);
    Result<void> waitForRoom() REQUIRES(writerMutex_);
    bool isFull() const REQUIRES(mutex_);
    void freeze() REQUIRES(writerMutex_, mutex_);

    // Checkpoints.
    Result<void> writeCheckpoint() EXCLUDES(checkpointMutex_);
    TablesHead headFor(const Overlay& overlay, std::uint64_t lastBatch, const HighWaterMarks& marks) const
        REQUIRES(checkpointMutex_);
    void checkpointSucceeded(std::uint64_t lastBatch);
    void checkpointFailed(const KsError& error);
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
    KsUUID uuid_;
    bool opened_ = false;
    std::thread checkpointThread_;

    std::atomic<std::uint64_t> transactionCount_{0};
    std::atomic<bool> isSuspect_{
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

    /// Held for moments only, never over a system call that may wait for the disk.
    mutable Mutex mutex_;
    Condition dueChanged_;
    std::shared_ptr<Overlay> active_ GUARDED_BY(mutex_) = std::make_shared<Overlay>();
    std::shared_ptr<const Overlay> frozen_ GUARDED_BY(mutex_);  // Null when everything before active_ is in the tables.
    std::uint64_t frozenLastBatch_ GUARDED_BY(mutex_) = 0;
    std::uint64_t savedBatch_ GUARDED_BY(mutex_) = 0;
    std::uint64_t frozenCountSaved_ GUARDED_BY(mutex_) =
        0;  // A snapshot taken before it grew may lack what left the overlay.
    Counts counts_ GUARDED_BY(mutex_);
    std::optional<std::chrono::steady_clock::time_point> due_ GUARDED_BY(mutex_);  // Of active_.
    std::chrono::steady_clock::time_point retryAt_ GUARDED_BY(mutex_);             // Of frozen_.
    std::optional<KsError> lastFailure_ GUARDED_BY(mutex_);
    std::uint64_t failures_ GUARDED_BY(mutex_) = 0;
    bool stopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
