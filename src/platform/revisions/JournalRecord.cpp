#include "platform/revisions/JournalRecord.h"

namespace cindral {

namespace {

// The first byte of a value of the table `events`. Written to disk: add numbers, never change one.
enum class EventKind : std::uint8_t { present = 1, departed = 2, moved = 3 };

bool isOf(EventKind kind, ByteView bytes) {
    return !bytes.empty() && bytes[0] == std::byte{static_cast<std::uint8_t>(kind)};
}

constexpr std::size_t kNameSizeOffset = Departure::kHeadBytes - 2;

}  // namespace

Bytes Departure::encode() const {
    Bytes bytes(kHeadBytes + name.size() + path.size());
    std::byte* to = bytes.data();
    storeInteger(to, static_cast<std::uint8_t>(goesOn ? EventKind::moved : EventKind::departed));
    storeInteger(to + 1, static_cast<std::uint64_t>(fileID));
    storeInteger(to + 9, static_cast<std::uint32_t>(documentID));
    storeInteger(to + 13, static_cast<std::uint64_t>(parent));
    storeInteger(to + 21, static_cast<std::uint8_t>(objectKind));
    storeInteger(to + 22, static_cast<std::uint64_t>(root));
    storeInteger(to + kNameSizeOffset, static_cast<std::uint16_t>(name.size()));
    std::memcpy(to + kHeadBytes, name.data(), name.size());
    std::memcpy(to + kHeadBytes + name.size(), path.data(), path.size());
    return bytes;
}

std::optional<Departure> Departure::decode(ByteView bytes) {
    const bool goesOn = isOf(EventKind::moved, bytes);
    if (bytes.size() < kHeadBytes || (!goesOn && !isOf(EventKind::departed, bytes))) return std::nullopt;
    const std::size_t nameSize = loadInteger<std::uint16_t>(bytes.data() + kNameSizeOffset);
    const ByteView names = bytes.subspan(kHeadBytes);
    if (nameSize > PackedRecord::kNameBytesMax || nameSize > names.size() || names.size() - nameSize > kPathBytesMax)
        return std::nullopt;
    const auto kind = loadInteger<std::uint8_t>(bytes.data() + 21);
    return Departure{
        .fileID = FileID{loadInteger<std::uint64_t>(bytes.data() + 1)},
        .documentID = DocumentID{loadInteger<std::uint32_t>(bytes.data() + 9)},
        .parent = FileID{loadInteger<std::uint64_t>(bytes.data() + 13)},
        .objectKind = kind <= static_cast<std::uint8_t>(ObjectKind::package) ? ObjectKind{kind} : ObjectKind::other,
        .root = FileID{loadInteger<std::uint64_t>(bytes.data() + 22)},
        .name = textOf(names.first(nameSize)),
        .path = textOf(names.subspan(nameSize)),
        .goesOn = goesOn,
    };
}

Bytes DocumentChange::encode() const {
    Bytes bytes(kBytes);
    storeInteger(bytes.data(), static_cast<std::uint32_t>(documentID));
    storeInteger(bytes.data() + 4, static_cast<std::uint64_t>(source));
    storeInteger(bytes.data() + 12, static_cast<std::uint64_t>(target));
    return bytes;
}

std::optional<DocumentChange> DocumentChange::decode(ByteView bytes) {
    if (bytes.size() != kBytes) return std::nullopt;
    return DocumentChange{.documentID = DocumentID{loadInteger<std::uint32_t>(bytes.data())},
                          .source = FileID{loadInteger<std::uint64_t>(bytes.data() + 4)},
                          .target = FileID{loadInteger<std::uint64_t>(bytes.data() + 12)}};
}

void Presence::encode(std::byte* to) const {
    storeInteger(to, static_cast<std::uint8_t>(EventKind::present));
    storeInteger(to + 1, static_cast<std::uint64_t>(fileID));
}

std::optional<Presence> Presence::decode(ByteView bytes) {
    if (bytes.size() != kBytes || !isOf(EventKind::present, bytes)) return std::nullopt;
    return Presence{FileID{loadInteger<std::uint64_t>(bytes.data() + 1)}};
}

void encodeDocument(const DocumentRecord& document, std::byte* to) {
    storeInteger(to, static_cast<std::uint64_t>(document.fileID));
    storeInteger(to + 8, document.birthTime);
}

std::optional<DocumentRecord> decodeDocument(ByteView bytes) {
    if (bytes.size() != kDocumentBytes) return std::nullopt;
    return DocumentRecord{FileID{loadInteger<std::uint64_t>(bytes.data())},
                          loadInteger<std::int64_t>(bytes.data() + 8)};
}

bool canBeName(std::string_view name) {
    return name.size() <= PackedRecord::kNameBytesMax &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

}  // namespace cindral
