#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/revisions/JournalRecord.h"
#include "platform/revisions/NameHash.h"
#include "platform/revisions/PackedRecord.h"

namespace cindral {

/// What one log file holds and the tables don't have yet: the newest record of each object, the documents given, and
/// the events.
///
/// About 110 bytes and the name for each record. Memory is taken as records come.
///
/// Thread safety: the caller's. Once nobody writes to it any more, everybody may read.
class Overlay {
public:
    // MARK: Objects

    /// Takes the record in place of an older one of the object. `isNewEvent`: its event was journalled with it.
    void put(FileID fileID, const PackedRecord& record, std::uint32_t hash, bool isNewEvent);
    /// From now on it is known that there is no such object.
    void putGone(FileID fileID);

    struct State {
        bool isKnown = false;  ///< what lies below doesn't count
        std::optional<PackedRecord> record;
    };
    /// The name points into the overlay and lives as long as it.
    State find(FileID fileID) const;
    /// Calls `use(fileID, record)` with each object whose record here says that it has a name with the hash in the
    /// folder, until it answers true.
    template <typename Use>
    bool findChild(FileID parent, std::uint32_t hash, Use use) const;
    /// Objects that have, or had, a record here that says they are in the folder. Some more than once.
    const std::vector<FileID>* arrivals(FileID parent) const;
    /// What this overlay changes in the number of a folder's children.
    void addToChildCount(FileID parent, std::int64_t difference);
    std::int64_t childCountDifference(FileID parent) const;
    const std::unordered_map<FileID, std::int64_t>& childCountDifferences() const { return childCounts_; }

    struct Object {
        FileID fileID{};
        std::uint32_t hash = 0;
        ByteView packed;  ///< empty: gone
    };
    std::vector<Object> objectsInKeyOrder() const;

    // MARK: Documents

    void addDocument(DocumentID documentID, const DocumentRecord& document);
    /// The document, which was given before, has another object from now on.
    void handOver(DocumentID documentID, const DocumentRecord& document);
    std::optional<DocumentRecord> findDocument(DocumentID documentID) const;
    using Document = std::pair<DocumentID, DocumentRecord>;
    /// In the order of their IDs.
    const std::vector<Document>& documents() const { return documents_; }
    const std::map<DocumentID, DocumentRecord>& handedOver() const { return handedOver_; }
    void putAttributes(DocumentID documentID, ByteView attributes);
    /// Empty ones: it has none.
    const std::map<DocumentID, Bytes>& attributes() const { return attributes_; }

    // MARK: Other names

    /// None: gone.
    void putName(const NameKey& key, std::optional<std::string> name);
    const std::map<NameKey, std::optional<std::string>>& names() const { return names_; }
    using Place = std::tuple<FileID, std::uint32_t, FileID, std::uint16_t>;  // Folder, hash, object, index.
    /// Those that are there, by where they are.
    const std::set<Place>& namePlaces() const { return namePlaces_; }

    // MARK: Events

    void addDeparture(std::uint64_t eventID, ByteView packed);
    void addDocumentChange(std::uint64_t eventID, const DocumentChange& change);
    void addTimeMark(std::uint64_t eventID, std::int64_t time) { timeMarks_.emplace_back(eventID, time); }
    /// From now on the history begins after the event.
    void beginHistory(std::uint64_t eventID);
    /// 0 where this changes nothing of it.
    std::uint64_t historyBegin() const { return historyBegin_; }
    /// Each list in the order of the events. Of presences only those are good whose object still has the event.
    const std::vector<std::pair<std::uint64_t, FileID>>& presences() const { return presences_; }
    const std::vector<std::pair<std::uint64_t, ByteView>>& departures() const { return departures_; }
    const std::vector<std::pair<std::uint64_t, DocumentChange>>& documentChanges() const { return documentChanges_; }
    const std::vector<std::pair<std::uint64_t, std::int64_t>>& timeMarks() const { return timeMarks_; }
    /// 0 where there is none.
    std::uint64_t lastEvent() const;
    /// Of those that may be good; the largest number where there is none.
    std::uint64_t firstEvent() const;
    /// Whether the presence is good.
    bool isCurrent(const std::pair<std::uint64_t, FileID>& presence) const;

    // MARK: Room

    bool empty() const { return bytes_ == 0; }
    /// Bytes of what it holds, replaced records included.
    std::size_t bytes() const { return bytes_; }
    std::size_t count() const { return count_; }

private:
    std::byte* allocate(std::size_t size);
    std::size_t slotOf(FileID fileID) const;
    const std::byte* newest(FileID fileID) const;
    bool isNewest(const std::byte* entry) const { return newest(keyOf(entry)) == entry; }
    std::byte* addEntry(FileID fileID, std::uint32_t hash, std::size_t packedBytes);
    void grow();
    static std::size_t childSlot(FileID parent, std::uint32_t hash, std::size_t slots);
    void addChildEntry(FileID parent, std::uint32_t hash, const std::byte* entry);
    void growChildren();
    void dropOldPresences();
    static FileID keyOf(const std::byte* entry);
    static std::uint32_t hashOf(const std::byte* entry);
    static ByteView packedOf(const std::byte* entry);

    struct Unmap {
        std::size_t bytes = 0;
        void operator()(std::byte* chunk) const;
    };
    std::vector<std::unique_ptr<std::byte, Unmap>> chunks_;
    std::size_t chunkLeft_ = 0;
    std::byte* chunkNext_ = nullptr;
    // Open addressing, a power of two; each points to an entry: see the source.
    std::vector<const std::byte*> slots_;
    std::size_t count_ = 0;
    std::size_t bytes_ = 0;
    // The same entries by folder and hash. Replaced ones stay in it until it grows.
    std::vector<const std::byte*> childSlots_;
    std::size_t childEntries_ = 0;
    std::unordered_map<FileID, std::vector<FileID>> arrivals_;
    std::unordered_map<FileID, std::int64_t> childCounts_;

    std::vector<Document> documents_;
    std::map<DocumentID, DocumentRecord> handedOver_;
    std::map<DocumentID, Bytes> attributes_;
    std::map<NameKey, std::optional<std::string>> names_;
    std::set<Place> namePlaces_;

    std::vector<std::pair<std::uint64_t, FileID>> presences_;
    std::size_t presencesKept_ = 0;  // When replaced ones were last dropped.
    std::vector<std::pair<std::uint64_t, ByteView>> departures_;
    std::vector<std::pair<std::uint64_t, DocumentChange>> documentChanges_;
    std::vector<std::pair<std::uint64_t, std::int64_t>> timeMarks_;
    std::uint64_t historyBegin_ = 0;
};

template <typename Use>
bool Overlay::findChild(FileID parent, std::uint32_t hash, Use use) const {
    if (childEntries_ == 0) return false;
    const std::size_t mask = childSlots_.size() - 1;
    for (std::size_t slot = childSlot(parent, hash, childSlots_.size()); childSlots_[slot] != nullptr;
         slot = (slot + 1) & mask) {
        const std::byte* entry = childSlots_[slot];
        if (hashOf(entry) != hash || !isNewest(entry)) continue;
        const auto record = PackedRecord::decode(packedOf(entry));
        if (record && record->parent == parent && use(keyOf(entry), *record)) return true;
    }
    return false;
}

}  // namespace cindral
