#pragma once

#include <cstdint>

#include "platform/foundation/Mutex.h"
#include "platform/revisions/HighWaterFile.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Gives document and event IDs, each once for ever: none leaves before its block is reserved on the disk.
///
/// Thread safety: all operations, from any thread; IDs are reserved and taken by one thread at a time.
class NumberSource {
public:
    /// The last document ID that is ever given.
    static constexpr std::uint32_t kLastDocumentID = 0xFFFF'FFFE;

    /// Goes on at the marks, which are at least the file's.
    NumberSource(HighWaterFile file, const HighWaterMarks& next);

    /// The first of so many document IDs in a row, which are reserved when it returns but not taken. ENOSPC beyond
    /// the last one.
    Result<std::uint32_t> reserveDocuments(std::size_t count);
    /// Has a block of document IDs ready, so that the first to be given waits for no disk.
    Result<void> reserveAhead();
    std::uint32_t nextDocument() const;
    void takeDocuments(std::size_t count);

    /// The first of so many event IDs in a row, which are reserved when it returns but not taken.
    Result<std::uint64_t> reserveEvents(std::uint64_t count);
    void takeEvents(std::uint64_t count);
    std::uint64_t currentEvent() const;
    Result<std::uint64_t> advanceEvent();

    HighWaterMarks reserved() const;
    /// Brings a file that lost its marks up to date.
    Result<void> repairFile();
    /// Gives back what was reserved and not taken. The last thing that is done.
    Result<void> giveBackTheRest();

private:
    Result<void> reserve(const HighWaterMarks& marks) REQUIRES(mutex_);

    mutable Mutex mutex_;
    HighWaterFile file_ GUARDED_BY(mutex_);
    HighWaterMarks next_ GUARDED_BY(mutex_);
    HighWaterMarks reserved_ GUARDED_BY(mutex_);
};

}  // namespace cindral
