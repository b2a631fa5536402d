#include "platform/revisions/VolumeLog.h"

#include <limits>

#include "platform/revisions/Checksum.h"

namespace cindral {

namespace {

constexpr std::uint32_t kBatchMagic = 0x32425643;  // "CVB2". Written to disk: never change it.

// Batch head: magic u32, payload bytes u32, sequence u64, checksum u32.
constexpr std::size_t kChecksumOffset = 16;
constexpr std::size_t kBatchHeadBytes = 20;
// Record head: key u64, type u8, bytes of the value u32.
constexpr std::size_t kRecordHeadBytes = 13;
constexpr std::size_t kBatchCapacityKept = 1 << 20;

std::uint32_t checksum(const KsUUID& store, ByteView batch) {
    const std::uint32_t bound = crc32c(std::as_bytes(std::span(store.bytes)));
    return crc32c(batch.subspan(kBatchHeadBytes), crc32c(batch.first(kChecksumOffset), bound));
}

bool isDocumentKey(std::uint64_t key) {
    return key != 0 && key <= std::numeric_limits<std::uint32_t>::max();
}

/// Whether the record is one that a store may have written.
bool isGood(const LogRecord& record) {
    switch (record.type) {
        case LogRecordType::object: return PackedRecord::decode(record.value).has_value();
        case LogRecordType::objectWithDocument: {
            const auto packed = PackedRecord::decode(record.value);
            return packed && packed->documentID != DocumentID{};
        }
        case LogRecordType::objectGone: return record.value.empty();
        case LogRecordType::documentGiven:
        case LogRecordType::documentHandedOver:
            return isDocumentKey(record.key) && record.value.size() == kDocumentBytes;
        case LogRecordType::otherName:
            return record.value.size() >= LogRecord::kNameHeadBytes &&
                   record.value.size() <= LogRecord::kNameHeadBytes + PackedRecord::kNameBytesMax;
        case LogRecordType::otherNameGone: return record.value.size() == LogRecord::kNameHeadBytes;
        case LogRecordType::departure: return Departure::decode(record.value).has_value();
        case LogRecordType::documentChange: return DocumentChange::decode(record.value).has_value();
        case LogRecordType::attributes:
            // Of document 0: what is remembered of the volume itself.
            return (record.key == 0 || isDocumentKey(record.key)) && record.value.size() <= kAttributesBytesMax;
        case LogRecordType::timeMark: return record.value.size() == sizeof(std::int64_t);
        case LogRecordType::historyBegin: return record.key != 0 && record.value.empty();
    }
    return false;
}

/// The first record of the payload, which is moved behind it. None when there is no good one.
std::optional<LogRecord> takeRecord(ByteView& payload) {
    if (payload.size() < kRecordHeadBytes) return std::nullopt;
    const std::size_t size = loadInteger<std::uint32_t>(payload.data() + 9);
    if (size > payload.size() - kRecordHeadBytes) return std::nullopt;
    const LogRecord record{.type = LogRecordType{loadInteger<std::uint8_t>(payload.data() + 8)},
                           .key = loadInteger<std::uint64_t>(payload.data()),
                           .value = payload.subspan(kRecordHeadBytes, size)};
    payload = payload.subspan(kRecordHeadBytes + size);
    return isGood(record) ? std::optional(record) : std::nullopt;
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

NameKey LogRecord::nameKey() const {
    return {.fileID = fileID(),
            .parent = FileID{loadInteger<std::uint64_t>(value.data())},
            .hash = loadInteger<std::uint32_t>(value.data() + 8),
            .index = loadInteger<std::uint16_t>(value.data() + 12)};
}

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

std::byte* BatchWriter::add(LogRecordType type, std::uint64_t key, std::size_t valueBytes) {
    const std::size_t at = bytes_.size();
    bytes_.resize(at + kRecordHeadBytes + valueBytes);
    std::byte* to = bytes_.data() + at;
    storeInteger(to, key);
    storeInteger(to + 8, static_cast<std::uint8_t>(type));
    storeInteger(to + 9, static_cast<std::uint32_t>(valueBytes));
    ++count_;
    return to + kRecordHeadBytes;
}

void BatchWriter::add(LogRecordType type, std::uint64_t key, ByteView value) {
    std::byte* to = add(type, key, value.size());
    if (!value.empty()) std::memcpy(to, value.data(), value.size());
}

void BatchWriter::addObject(FileID fileID, bool givesDocument, const PackedRecord& record) {
    const auto type = givesDocument ? LogRecordType::objectWithDocument : LogRecordType::object;
    record.encode(add(type, static_cast<std::uint64_t>(fileID), record.encodedBytes()));
}

void BatchWriter::addDocument(LogRecordType type, DocumentID documentID, const DocumentRecord& document) {
    encodeDocument(document, add(type, static_cast<std::uint32_t>(documentID), kDocumentBytes));
}

std::byte* BatchWriter::addName(LogRecordType type, const NameKey& key, std::size_t nameBytes) {
    std::byte* to = add(type, static_cast<std::uint64_t>(key.fileID), LogRecord::kNameHeadBytes + nameBytes);
    storeInteger(to, static_cast<std::uint64_t>(key.parent));
    storeInteger(to + 8, key.hash);
    storeInteger(to + 12, key.index);
    return to + LogRecord::kNameHeadBytes;
}

void BatchWriter::addOtherName(const NameKey& key, std::string_view name) {
    std::memcpy(addName(LogRecordType::otherName, key, name.size()), name.data(), name.size());
}

void BatchWriter::addOtherNameGone(const NameKey& key) {
    addName(LogRecordType::otherNameGone, key, 0);
}

void BatchWriter::addTimeMark(std::uint64_t eventID, std::int64_t time) {
    storeInteger(add(LogRecordType::timeMark, eventID, sizeof time), time);
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
