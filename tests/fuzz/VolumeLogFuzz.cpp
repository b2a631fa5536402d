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

// Written again from what was read of it, a batch has the same bytes.
void checkBatch(const volumelog::Batch& batch, const KsUUID& store, ByteView original) {
    BatchWriter writer;
    writer.begin();
    std::size_t payloadBytes = 0;
    for (const LogRecord& record : volumelog::records(batch)) {
        const auto packed = PackedRecord::decode(record.packed);
        require(packed.has_value());
        payloadBytes += 11 + record.packed.size();
        if (record.packed[20] > std::byte{3}) return;  // A kind of a later version is read as another.
        writer.add(record.fileID, record.givesDocument, *packed);
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
