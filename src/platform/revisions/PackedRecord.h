#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Integers as the store's files have them: little-endian, at any alignment.
template <typename Integer>
Integer loadInteger(const std::byte* from) {
    Integer value;
    std::memcpy(&value, from, sizeof value);
    if constexpr (std::endian::native == std::endian::big) {
        auto* bytes = reinterpret_cast<std::byte*>(&value);
        for (std::size_t i = 0; i < sizeof value / 2; ++i) std::swap(bytes[i], bytes[sizeof value - 1 - i]);
    }
    return value;
}

template <typename Integer>
void storeInteger(std::byte* to, Integer value) {
    std::memcpy(to, &value, sizeof value);
    if constexpr (std::endian::native == std::endian::big) {
        for (std::size_t i = 0; i < sizeof value / 2; ++i) std::swap(to[i], to[sizeof value - 1 - i]);
    }
}

/// An object's record where it lies: the name points into the bytes that it was read from.
///
/// Encoded form: docs/volume-store.md, the same in the log, in memory and in the table.
///
/// Thread safety: a value.
struct PackedRecord {
    FileID parent{};
    std::int64_t birthTime = 0;
    DocumentID documentID{};
    ObjectKind kind = ObjectKind::other;
    bool isListed = false;
    bool isClosed = false;
    bool hasOtherNames = false;
    std::int64_t changeTime = 0;
    std::uint64_t size = 0;
    std::uint64_t eventID = 0;
    std::string_view name = {};

    static constexpr std::size_t kHeadBytes = 8 + 8 + 4 + 1 + 8 + 8 + 8;
    static constexpr std::size_t kKindOffset = 20;
    /// Far above any file system's; keeps a record within a page of the table.
    static constexpr std::size_t kNameBytesMax = 1023;

    friend bool operator==(const PackedRecord&, const PackedRecord&) = default;

    std::size_t encodedBytes() const { return kHeadBytes + name.size(); }
    /// Somebody may have its identifier.
    bool isKnownToSomebody() const { return isListed || documentID != DocumentID{}; }
    bool isAt(FileID itsParent, std::string_view itsName) const { return parent == itsParent && name == itsName; }

    /// Writes encodedBytes() bytes.
    void encode(std::byte* to) const {
        storeInteger(to, static_cast<std::uint64_t>(parent));
        storeInteger(to + 8, birthTime);
        storeInteger(to + 16, static_cast<std::uint32_t>(documentID));
        const auto flags = (isListed ? kListed : 0U) | (isClosed ? kClosed : 0U) | (hasOtherNames ? kOtherNames : 0U);
        storeInteger(to + kKindOffset, static_cast<std::uint8_t>(static_cast<std::uint8_t>(kind) | flags));
        storeInteger(to + 21, changeTime);
        storeInteger(to + 29, size);
        storeInteger(to + 37, eventID);
        std::memcpy(to + kHeadBytes, name.data(), name.size());
    }

    /// None when the bytes are too few or too many to be a record. A kind that is not known here is read as `other`.
    static std::optional<PackedRecord> decode(ByteView bytes) {
        if (bytes.size() < kHeadBytes || bytes.size() > kHeadBytes + kNameBytesMax) return std::nullopt;
        const auto kindAndFlags = loadInteger<std::uint8_t>(bytes.data() + kKindOffset);
        const std::uint8_t kind = kindAndFlags & kKindMask;
        return PackedRecord{
            .parent = FileID{loadInteger<std::uint64_t>(bytes.data())},
            .birthTime = loadInteger<std::int64_t>(bytes.data() + 8),
            .documentID = DocumentID{loadInteger<std::uint32_t>(bytes.data() + 16)},
            .kind = kind <= static_cast<std::uint8_t>(ObjectKind::package) ? ObjectKind{kind} : ObjectKind::other,
            .isListed = (kindAndFlags & kListed) != 0,
            .isClosed = (kindAndFlags & kClosed) != 0,
            .hasOtherNames = (kindAndFlags & kOtherNames) != 0,
            .changeTime = loadInteger<std::int64_t>(bytes.data() + 21),
            .size = loadInteger<std::uint64_t>(bytes.data() + 29),
            .eventID = loadInteger<std::uint64_t>(bytes.data() + 37),
            .name = textOf(bytes.subspan(kHeadBytes)),
        };
    }

private:
    // Written to disk: never change one.
    static constexpr std::uint8_t kKindMask = 0x0F;
    static constexpr std::uint8_t kListed = 0x10;
    static constexpr std::uint8_t kClosed = 0x20;
    static constexpr std::uint8_t kOtherNames = 0x40;
};

}  // namespace cindral
