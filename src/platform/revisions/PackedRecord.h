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
    std::string_view name;

    static constexpr std::size_t kHeadBytes = 8 + 8 + 4 + 1;
    /// Far above any file system's; keeps a record within a page of the table.
    static constexpr std::size_t kNameBytesMax = 1023;

    std::size_t size() const { return kHeadBytes + name.size(); }

    /// Writes size() bytes.
    void encode(std::byte* to) const {
        storeInteger(to, static_cast<std::uint64_t>(parent));
        storeInteger(to + 8, birthTime);
        storeInteger(to + 16, static_cast<std::uint32_t>(documentID));
        storeInteger(to + 20, static_cast<std::uint8_t>(kind));
        std::memcpy(to + kHeadBytes, name.data(), name.size());
    }

    /// None when the bytes are too few or too many to be a record. A kind that is not known here is read as `other`.
    static std::optional<PackedRecord> decode(ByteView bytes) {
        if (bytes.size() < kHeadBytes || bytes.size() > kHeadBytes + kNameBytesMax) return std::nullopt;
        const auto kind = loadInteger<std::uint8_t>(bytes.data() + 20);
        return PackedRecord{
            .parent = FileID{loadInteger<std::uint64_t>(bytes.data())},
            .birthTime = loadInteger<std::int64_t>(bytes.data() + 8),
            .documentID = DocumentID{loadInteger<std::uint32_t>(bytes.data() + 16)},
            .kind = kind <= static_cast<std::uint8_t>(ObjectKind::package) ? ObjectKind{kind} : ObjectKind::other,
            .name = textOf(bytes.subspan(kHeadBytes)),
        };
    }
};

}  // namespace cindral
