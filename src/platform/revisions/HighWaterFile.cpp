#include "platform/revisions/HighWaterFile.h"

#include <algorithm>

#include "platform/revisions/Checksum.h"
#include "platform/revisions/PackedRecord.h"

namespace cindral {

namespace {

// Written to disk: never change one.
constexpr std::uint64_t kSlotMagic = 0x3173'6469'2D6C'6463;  // "cdl-ids1"
constexpr std::size_t kSlotBytes = 28;                       // Magic u64, document u64, event u64, checksum u32.
constexpr std::size_t kSlotOffsets[] = {0, 4096};            // Blocks of their own: a torn or bad block takes one.

std::optional<HighWaterMarks> decodeSlot(ByteView slot) {
    if (loadInteger<std::uint64_t>(slot.data()) != kSlotMagic) return std::nullopt;
    if (loadInteger<std::uint32_t>(slot.data() + 24) != crc32c(slot.first(24))) return std::nullopt;
    return HighWaterMarks{loadInteger<std::uint64_t>(slot.data() + 8), loadInteger<std::uint64_t>(slot.data() + 16)};
}

}  // namespace

HighWaterMarks HighWaterMarks::highest(const HighWaterMarks& a, const HighWaterMarks& b) {
    return {std::max(a.document, b.document), std::max(a.event, b.event)};
}

Bytes encodeHighWaterSlot(const HighWaterMarks& marks) {
    Bytes slot(kSlotBytes);
    storeInteger(slot.data(), kSlotMagic);
    storeInteger(slot.data() + 8, marks.document);
    storeInteger(slot.data() + 16, marks.event);
    storeInteger(slot.data() + 24, crc32c(ByteView(slot).first(24)));
    return slot;
}

std::optional<HighWaterMarks> decodeHighWaterFile(ByteView bytes) {
    std::optional<HighWaterMarks> found;
    for (const std::size_t offset : kSlotOffsets) {
        if (bytes.size() < offset + kSlotBytes) continue;
        const auto marks = decodeSlot(bytes.subspan(offset, kSlotBytes));
        if (marks) found = HighWaterMarks::highest(found.value_or(*marks), *marks);
    }
    return found;
}

Result<HighWaterFile> HighWaterFile::open(int folder) {
    StoreFile file = TRY(StoreFile::open(folder, kName));
    const Bytes bytes = TRY(file.readAll());
    if (bytes.empty()) TRY(syncFolder(folder));  // Its name, too, has to be there after a power cut.
    return HighWaterFile(std::move(file), decodeHighWaterFile(bytes));
}

Result<void> HighWaterFile::write(const HighWaterMarks& marks) {
    const Bytes slot = encodeHighWaterSlot(marks);
    for (const std::size_t offset : kSlotOffsets) {
        TRY(file_.writeAt(offset, slot));
        TRY(file_.sync());
    }
    marks_ = marks;
    return {};
}

}  // namespace cindral
