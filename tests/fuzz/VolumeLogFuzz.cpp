#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "platform/revisions/Checksum.h"
#include "platform/revisions/HighWaterFile.h"
#include "platform/revisions/VolumeLog.h"

using namespace cindral;

namespace {

void require(bool holds) {
    if (!holds) std::abort();
}

void writeObject(BatchWriter& writer, const LogRecord& record) {
    const auto packed = PackedRecord::decode(record.value);
    require(packed.has_value());
    // A kind, or a flag, of a later version is read as another.
    Bytes again(packed->encodedBytes());
    packed->encode(again.data());
    if (std::memcmp(again.data(), record.value.data(), again.size()) == 0) {
        writer.addObject(record.fileID(), record.type == LogRecordType::objectWithDocument, *packed);
    } else {
        writer.add(record.type, record.key, record.value);
    }
}

void writeDeparture(BatchWriter& writer, const LogRecord& record) {
    const auto departure = Departure::decode(record.value);
    require(departure.has_value());
    require(Departure::decode(departure->encode()) == departure);
    writer.add(record.type, record.key, record.value);
}

void write(BatchWriter& writer, const LogRecord& record) {
    switch (record.type) {
        case LogRecordType::object:
        case LogRecordType::objectWithDocument: return writeObject(writer, record);
        case LogRecordType::objectGone: return writer.addObjectGone(record.fileID());
        case LogRecordType::documentGiven:
        case LogRecordType::documentHandedOver:
            return writer.addDocument(record.type, record.documentID(), *decodeDocument(record.value));
        case LogRecordType::otherName: return writer.addOtherName(record.nameKey(), record.otherName());
        case LogRecordType::otherNameGone: return writer.addOtherNameGone(record.nameKey());
        case LogRecordType::departure: return writeDeparture(writer, record);
        case LogRecordType::documentChange:
            return writer.add(record.type, record.key, DocumentChange::decode(record.value).value().encode());
        case LogRecordType::attributes: return writer.add(record.type, record.key, record.value);
        case LogRecordType::timeMark: return writer.addTimeMark(record.key, record.time());
        case LogRecordType::historyBegin: return writer.add(record.type, record.key, ByteView());
    }
    require(false);
}

// Written again from what was read of it, a batch has the same bytes.
void checkBatch(const volumelog::Batch& batch, const KsUUID& store, ByteView original) {
    BatchWriter writer;
    writer.begin();
    std::size_t payloadBytes = 0;
    for (const LogRecord& record : volumelog::records(batch)) {
        payloadBytes += 13 + record.value.size();
        write(writer, record);
    }
    require(payloadBytes == batch.payload.size());
    const ByteView again = writer.finish(store, batch.sequence);
    require(again.size() == original.size() && std::memcmp(again.data(), original.data(), again.size()) == 0);
}

// Numbers of decoded batches are unbroken, and the batches lie one behind the other from the beginning.
void checkLog(ByteView bytes, const KsUUID& store) {
    const auto batches = volumelog::decode(bytes, store);
    std::size_t at = 0;
    for (std::size_t i = 0; i < batches.size(); ++i) {
        require(i == 0 || batches[i].sequence == batches[i - 1].sequence + 1);
        const std::size_t size = 20 + batches[i].payload.size();
        require(batches[i].payload.data() == bytes.data() + at + 20);
        checkBatch(batches[i], store, bytes.subspan(at, size));
        at += size;
    }
    require(at <= bytes.size());
}

// Puts right checksums into what looks like batches, so that what lies behind the checksum is explored, too.
Bytes withGoodChecksums(ByteView bytes, const KsUUID& store) {
    Bytes repaired(bytes.begin(), bytes.end());
    std::size_t at = 0;
    while (repaired.size() - at >= 20) {
        const std::size_t size = loadInteger<std::uint32_t>(repaired.data() + at + 4);
        if (size > repaired.size() - at - 20) break;
        const ByteView whole = ByteView(repaired).subspan(at, 20 + size);
        const std::uint32_t bound = crc32c(std::as_bytes(std::span(store.bytes)));
        storeInteger(repaired.data() + at + 16, crc32c(whole.subspan(20), crc32c(whole.first(16), bound)));
        at += whole.size();
    }
    return repaired;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const ByteView bytes = std::as_bytes(std::span(data, size));
    const KsUUID store{};
    checkLog(bytes, store);
    checkLog(withGoodChecksums(bytes, store), store);
    if (const auto marks = decodeHighWaterFile(bytes)) {
        const Bytes slot = encodeHighWaterSlot(*marks);
        require(decodeHighWaterFile(slot) == marks);
    }
    return 0;
}
