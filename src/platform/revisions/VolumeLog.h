#pragma once

#include <cstdint>
#include <vector>

#include "platform/foundation/KsUUID.h"
#include "platform/revisions/PackedRecord.h"
#include "platform/revisions/StoreFile.h"

namespace cindral {

/// One record of a batch: an object as it was seen.
struct LogRecord {
    FileID fileID{};
    bool givesDocument = false;  ///< its document ID was given with this very sighting
    ByteView packed;             ///< a PackedRecord; points into the log's bytes
};

/// The batches of a log file: what each identify() that had news wrote, whole or not at all.
///
/// Format: docs/volume-store.md. A batch is bound to its store by the checksum, which begins with the store's UUID, so
/// that a log of another store, or of the store that was here before, is no log at all.
namespace volumelog {

struct Batch {
    std::uint64_t sequence = 0;
    ByteView payload;
};

/// The whole batches at the beginning of the bytes, their numbers in unbroken order; what follows is a torn tail.
/// Any bytes may be passed.
std::vector<Batch> decode(ByteView bytes, const KsUUID& store);
/// The records of a batch that decode() gave.
std::vector<LogRecord> records(const Batch& batch);

}  // namespace volumelog

/// Builds one batch.
///
/// Thread safety: the caller's.
class BatchWriter {
public:
    void begin();
    void add(FileID fileID, bool givesDocument, const PackedRecord& record);
    std::size_t count() const { return count_; }
    /// The finished batch; good until the next begin().
    ByteView finish(const KsUUID& store, std::uint64_t sequence);

private:
    Bytes bytes_;
    std::uint32_t count_ = 0;
};

/// A log file that batches are appended to.
///
/// Thread safety: the caller's.
class LogFile {
public:
    LogFile() = default;
    explicit LogFile(StoreFile file) : file_(std::move(file)) {}

    std::uint64_t size() const { return size_; }
    Result<Bytes> readAll() const { return file_.readAll(); }
    /// The whole batch, or an error and nothing: what was written of it is cut off again.
    Result<void> append(ByteView batch);
    /// Empties the file. What a power cut brings back of it is skipped by its batches' numbers.
    Result<void> clear();
    /// Empties the file, on the disk.
    Result<void> clearDurably();

private:
    StoreFile file_;
    std::uint64_t size_ = 0;  // Of the good batches; what lies beyond is overwritten.
};

}  // namespace cindral
