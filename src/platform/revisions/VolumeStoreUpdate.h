#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <memory_resource>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/revisions/JournalRecord.h"
#include "platform/revisions/VolumeStoreImplementation.h"

namespace cindral {

/// The changes of one batch while they are decided: what each object was and what it is to be, and the events that
/// follow. Nothing of it is seen by anybody before it is written to the log and to the overlay.
///
/// Thread safety: the holder's of the writer's lock.
class VolumeStore::Implementation::Update {
public:
    struct Numbers {
        std::uint64_t event = 0;  ///< the next of each
        std::uint32_t document = 0;
    };
    /// Everything is borrowed for life. `journals` off: no event is made.
    Update(const Implementation& store, std::span<const FileID> roots, bool journals, Numbers next);

    /// Looks at many objects at once, before they are changed one by one.
    template <typename FileIDAt>
    Result<void> load(std::size_t count, FileIDAt fileIDAt);

    // What happens. Names are borrowed until the update was written.
    /// Answers the object's document ID, which it may have been given.
    DocumentID sight(const ObjectSighting& sighting);
    void put(const IndexedObject& object, std::string_view name);
    void remove(FileID fileID);
    void touch(FileID fileID);
    void addName(FileID fileID, FileID parent, std::string_view name);
    void removeName(FileID fileID, FileID parent, std::string_view name);
    void leave(FileID fileID, FileID folder);
    /// ENOENT when the object is not recorded, or the document was never given.
    Result<void> handOver(DocumentID documentID, FileID to);
    void putAttributes(DocumentID documentID, ByteView attributes) { attributes_.emplace(documentID, attributes); }
    void markTime(std::int64_t now) { timeMark_ = now; }

    std::uint64_t eventCount() const { return nextEvent_ - first_.event; }
    std::size_t documentCount() const { return given_.size(); }
    std::uint64_t firstEvent() const { return first_.event; }

    void writeTo(BatchWriter& batch);
    /// After writeTo().
    void writeTo(Overlay& overlay, Counts& counts, std::uint64_t forgottenEvent) const;

private:
    struct Object {
        FileID fileID{};
        bool wasThere = false;
        bool isThere = false;
        std::uint32_t hash = 0;  // Of the name that it has now; once it is written.
        PackedRecord before;
        PackedRecord now;

        bool isChanged() const { return wasThere != isThere || (isThere && !(before == now)); }
    };
    Object* find(FileID fileID);
    Object& add(FileID fileID, const PackedRecord* record);
    Object& object(FileID fileID);
    std::size_t slotOf(FileID fileID) const;
    void grow();

    void remove(Object& object);
    void forget(Object& object);
    void depart(const Object& object, bool goesOn);
    void announce(Object& object);
    void changeDocument(DocumentID documentID, FileID source, FileID target);
    std::optional<DocumentRecord> document(DocumentID documentID) const;
    std::optional<NameKey> nameKey(const Names& names, FileID parent, std::string_view name, std::uint32_t hash) const;
    Names names(FileID fileID) const;
    bool isGivenNow(const Object& object) const;
    bool hasNewEvent(const Object& object) const { return object.isThere && object.now.eventID >= first_.event; }

    struct Place {
        std::string path;
        std::optional<FileID> root;  // None where the path could not be made out.
    };
    Place placeOf(const Object& object);
    const Place& placeOfFolder(FileID fileID);
    void placesChanged(const PackedRecord& record);

    const Implementation& store_;
    const std::span<const FileID> roots_;
    const bool journals_;
    const Numbers first_;
    std::uint64_t nextEvent_;

    std::pmr::monotonic_buffer_resource texts_;  // Names of records as they were.
    std::deque<Object> objects_;
    std::vector<std::uint32_t> slots_;  // Open addressing, a power of two: places in objects_, and one more.
    std::vector<Overlay::Document> given_;
    std::map<DocumentID, DocumentRecord> handedOver_;
    std::map<DocumentID, ByteView> attributes_;
    std::map<NameKey, std::optional<std::string>> names_;
    std::vector<std::pair<std::uint64_t, Bytes>> departures_;
    std::vector<std::pair<std::uint64_t, DocumentChange>> documentChanges_;
    std::optional<std::int64_t> timeMark_;

    // The folder whose place was asked for last.
    std::optional<FileID> placedFolder_;
    Place place_;
};

}  // namespace cindral
