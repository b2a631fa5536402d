#include "platform/revisions/VolumeLog.h"

#include <limits>

#include "platform/revisions/Checksum.h"

namespace cindral {

namespace {

// Written to disk: never change one.
constexpr std::uint32_t kBatchMagic = 0x31425643;  // "CVB1"
enum class RecordType : std::uint8_t { sighting = 1, sightingThatGivesDocument = 2 };

// Batch head: magic u32, payload bytes u32, sequence u64, checksum u32.
constexpr std::size_t kChecksumOffset = 16;
constexpr std::size_t kBatchHeadBytes = 20;
// Record head: file ID u64, type u8, bytes of the packed record u16.
constexpr std::size_t kRecordHeadBytes = 11;
constexpr std::size_t kBatchCapacityKept = 1 << 20;

std::uint32_t checksum(const KsUUID& store, ByteView batch) {
    const std::uint32_t bound = crc32c(std::as_bytes(std::span(store.bytes)));
    return crc32c(batch.subspan(kBatchHeadBytes), crc32c(batch.first(kChecksumOffset), bound));
}

/// The first record of the payload, which is moved behind it. None when there is no good one.
std::optional<LogRecord> takeRecord(ByteView& payload) {
    if (payload.size() < kRecordHeadBytes) return std::nullopt;
    const auto type = loadInteger<std::uint8_t>(payload.data() + 8);
    const std::size_t size = loadInteger<std::uint16_t>(payload.data() + 9);
    if (type < 1 || type > 2 || size > payload.size() - kRecordHeadBytes) return std::nullopt;
    LogRecord record{.fileID = FileID{loadInteger<std::uint64_t>(payload.data())},
                     .givesDocument = RecordType{type} == RecordType::sightingThatGivesDocument,
                     .packed = payload.subspan(kRecordHeadBytes, size)};
    payload = payload.subspan(kRecordHeadBytes + size);
    const auto packed = PackedRecord::decode(record.packed);
    if (!packed || (record.givesDocument && packed->documentID == DocumentID{})) return std::nullopt;
    return record;
}

bool isWellFormed(ByteView payload) {
    while (!payload.empty()) {
        if (!takeRecord(payload)) return false;
    }
    return true;
}

std::optional<volumelog::Batch> takeBatch(ByteView& bytes, const KsUUID& store) {
    if (bytes.size() < kBatchHeadBytes) return std::nullopt;
    const std::size_t size = loadInteger<std::uint32_t>(bytes.data() + 4);
    if (loadInteger<std::uint32_t>(bytes.data()) != kBatchMagic || size > bytes.size() - kBatchHeadBytes) {
        return std::nullopt;
    }
    const ByteView whole = bytes.first(kBatchHeadBytes + size);
    if (checksum(store, whole) != loadInteger<std::uint32_t>(whole.data() + kChecksumOffset)) return std::nullopt;
    const volumelog::Batch batch{.sequence = loadInteger<std::uint64_t>(whole.data() + 8),
                                 .payload = whole.subspan(kBatchHeadBytes)};
    if (!isWellFormed(batch.payload)) return std::nullopt;
    bytes = bytes.subspan(whole.size());
    return batch;
}

}  // namespace

namespace volumelog {

std::vector<Batch> decode(ByteView bytes, const KsUUID& store) {
    std::vector<Batch> batches;
    while (const auto batch = takeBatch(bytes, store)) {
        if (!batches.empty() && batch->sequence != batches.back().sequence + 1) break;
        batches.push_back(*batch);
    }
    return batches;
}

std::vector<LogRecord> records(const Batch& batch) {
    std::vector<LogRecord> all;
    ByteView rest = batch.payload;
    while (const auto record = takeRecord(rest)) all.push_back(*record);
    return all;
}

}  // namespace volumelog

void BatchWriter::begin() {
    // One enormous batch shall not hold its memory for ever.
    if (bytes_.capacity() > kBatchCapacityKept) Bytes().swap(bytes_);
    bytes_.assign(kBatchHeadBytes, std::byte{});
    count_ = 0;
}

void BatchWriter::add(FileID fileID, bool givesDocument, const PackedRecord& record) {
    const auto type = givesDocument ? RecordType::sightingThatGivesDocument : RecordType::sighting;
    const std::size_t at = bytes_.size();
    bytes_.resize(at + kRecordHeadBytes + record.size());
    std::byte* to = bytes_.data() + at;
    storeInteger(to, static_cast<std::uint64_t>(fileID));
    storeInteger(to + 8, static_cast<std::uint8_t>(type));
    storeInteger(to + 9, static_cast<std::uint16_t>(record.size()));
    record.encode(to + kRecordHeadBytes);
    ++count_;
}

ByteView BatchWriter::finish(const KsUUID& store, std::uint64_t sequence) {
    storeInteger(bytes_.data(), kBatchMagic);
    storeInteger(bytes_.data() + 4, static_cast<std::uint32_t>(bytes_.size() - kBatchHeadBytes));
    storeInteger(bytes_.data() + 8, sequence);
    storeInteger(bytes_.data() + kChecksumOffset, checksum(store, bytes_));
    return bytes_;
}

Result<void> LogFile::append(ByteView batch) {
    if (batch.size() > std::numeric_limits<std::uint32_t>::max()) return KsError::posix(EFBIG);
    Result<void> written = file_.writeAt(size_, batch);
    if (!written.ok()) {
        // Where even this fails, the half batch has no good checksum, and the next one is written over it.
        (void)file_.truncate(size_);
        return written;
    }
    size_ += batch.size();
    return {};
}

Result<void> LogFile::clear() {
    size_ = 0;
    return file_.truncate(0);
}

Result<void> LogFile::clearDurably() {
    if (TRY(file_.size()) == 0) return {};
    TRY(clear());
    return file_.sync();
}

}  // namespace cindral
