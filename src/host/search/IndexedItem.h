#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "host/SearchQueries.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// What the search index keeps of an item.
///
/// Thread safety: a value.
struct IndexedItem {
    /// Written into the index: add bits, never change one.
    static constexpr std::int64_t kDocument = 1;  ///< a document or package; not a folder, nor anything special
    static constexpr std::int64_t kTrashed = 2;
    static constexpr std::int64_t kFolder = 4;  ///< with contents that are items of their own
    /// The temporary folder of a root, or somewhere in it: nothing that a person looks for.
    static constexpr std::int64_t kTemporary = 8;

    /// What everything below a folder has with it.
    static constexpr std::int64_t kPassedOn = kTrashed | kTemporary;

    TesselItemIdentifier identifier;
    TesselItemIdentifier parent;
    std::string name;  ///< bytes as in the file system
    std::string type;
    std::string domain;  ///< the application that it belongs to; empty for none
    std::int64_t flags = 0;
    std::optional<std::int64_t> modified;  ///< nanoseconds since 1970
    std::optional<std::int64_t> used;      ///< the same
    std::optional<std::int64_t> size;
    std::optional<std::int64_t> rank;
    std::vector<std::string> tags;  ///< sorted, each once

    /// Whether it is in a temporary folder, its parent has to tell.
    static IndexedItem of(const TesselItem& item);
    bool operator==(const IndexedItem&) const = default;

    /// What counts as the item's date where the newest come first.
    std::optional<std::int64_t> recency() const { return used ? used : modified; }
    bool isTrashed() const { return (flags & kTrashed) != 0; }
    bool isTemporary() const { return (flags & kTemporary) != 0; }
    /// Whether it is what people call their files: neither thrown away nor of a moment.
    bool isOrdinary() const { return !isTrashed() && !isTemporary(); }
    bool isFolder() const { return (flags & kFolder) != 0; }
    bool isDocument() const { return (flags & kDocument) != 0; }

    /// Whether the item is, or is part of, what the query answers.
    bool isIn(const SearchQuery& query) const;
};

}  // namespace cindral
