#pragma once

#include <cstdint>
#include <vector>

#include "platform/foundation/KsUUID.h"
#include "platform/revisions/JournalRecord.h"
#include "platform/revisions/NameHash.h"
#include "platform/revisions/PackedRecord.h"
#include "platform/revisions/StoreFile.h"

namespace cindral {

/// What one record of a batch says. Every one says what is so after it, not what was done: carried out again, on top of
/// whatever part of it was saved, it ends the same. Written to disk: add numbers, never change one.
enum class LogRecordType : std::uint8_t {
    object = 1,              ///< key: file ID; PackedRecord
    objectWithDocument = 2,  ///< the same; the document ID was given with this very batch
    objectGone = 3,          ///< key: file ID; with it go its other names that are told to go
    documentGiven = 4,       ///< key: document ID; its object, which is another by the end of the batch
    documentHandedOver = 5,  ///< key: document ID; its object from now on
    otherName = 6,           ///< key: file ID; place and name
    otherNameGone = 7,       ///< key: file ID; place
    departure = 8,           ///< key: event ID; Departure
    documentChange = 9,      ///< key: event ID; DocumentChange
    attributes = 10,         ///< key: document ID; the bytes
    timeMark = 11,           ///< key: event ID; the time at which it was journalled, ns since 1970
    historyBegin = 12,       ///< key: event ID; what happens after it is journalled
};

struct LogRecord {
    LogRecordType type = LogRecordType::object;
    std::uint64_t key = 0;
    ByteView value;  ///< points into the log's bytes

    FileID fileID() const { return FileID{key}; }
    DocumentID documentID() const { return DocumentID{static_cast<std::uint32_t>(key)}; }
    /// Of `otherName` and `otherNameGone`.
    NameKey nameKey() const;
    std::string_view otherName() const { return textOf(value.subspan(kNameHeadBytes)); }
    std::int64_t time() const { return loadInteger<std::int64_t>(value.data()); }

    // Folder u64, hash u32, index u16; the name follows.
    static constexpr std::size_t kNameHeadBytes = 14;
};

/// The batches of a log file: what each call that had news wrote, whole or not at all.
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
    void addObject(FileID fileID, bool givesDocument, const PackedRecord& record);
    void addObjectGone(FileID fileID) { add(LogRecordType::objectGone, static_cast<std::uint64_t>(fileID), 0); }
    void addDocument(LogRecordType type, DocumentID documentID, const DocumentRecord& document);
    void addOtherName(const NameKey& key, std::string_view name);
    void addOtherNameGone(const NameKey& key);
    void addTimeMark(std::uint64_t eventID, std::int64_t time);
    /// A record whose value is there already.
    void add(LogRecordType type, std::uint64_t key, ByteView value);
    std::size_t count() const { return count_; }
    /// The finished batch; good until the next begin().
    ByteView finish(const KsUUID& store, std::uint64_t sequence);

private:
    std::byte* add(LogRecordType type, std::uint64_t key, std::size_t valueBytes);
    std::byte* addName(LogRecordType type, const NameKey& key, std::size_t nameBytes);
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
