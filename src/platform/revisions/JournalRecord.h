#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/revisions/PackedRecord.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// What the journal keeps of an object that left a place: the names point into the bytes that it was read from.
///
/// Encoded form of this and the others here: docs/volume-store.md, the same in the log and in the tables.
///
/// Thread safety: a value.
struct Departure {
    FileID fileID{};
    DocumentID documentID{};
    FileID parent{};
    ObjectKind objectKind = ObjectKind::other;
    FileID root{};
    std::string_view name;
    std::string_view path;
    bool goesOn = false;  ///< it is listed as the same object wherever it went; otherwise it ended here

    static constexpr std::size_t kHeadBytes = 1 + 8 + 4 + 8 + 1 + 8 + 2;
    /// A path that is longer is left out: no call of the system could be given it in one piece.
    static constexpr std::size_t kPathBytesMax = 16'384;

    friend bool operator==(const Departure&, const Departure&) = default;

    Bytes encode() const;
    /// None for bytes that are no departure.
    static std::optional<Departure> decode(ByteView bytes);
};

/// A document that went from one object to another; target 0: it is no more.
struct DocumentChange {
    DocumentID documentID{};
    FileID source{};
    FileID target{};

    static constexpr std::size_t kBytes = 4 + 8 + 8;

    friend bool operator==(const DocumentChange&, const DocumentChange&) = default;

    Bytes encode() const;
    static std::optional<DocumentChange> decode(ByteView bytes);
};

/// The event of an object that is to be looked at: nothing but which.
struct Presence {
    FileID fileID{};

    static constexpr std::size_t kBytes = 1 + 8;

    void encode(std::byte* to) const;
    static std::optional<Presence> decode(ByteView bytes);
};

/// A document's object.
inline constexpr std::size_t kDocumentBytes = 16;
void encodeDocument(const DocumentRecord& document, std::byte* to);
std::optional<DocumentRecord> decodeDocument(ByteView bytes);

/// No file can have another name.
bool canBeName(std::string_view name);
/// What a store takes for the attributes of a document.
inline constexpr std::size_t kAttributesBytesMax = 65'536;

}  // namespace cindral
