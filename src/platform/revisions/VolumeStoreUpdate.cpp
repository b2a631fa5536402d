#include "platform/revisions/VolumeStoreUpdate.h"

#include <algorithm>
#include <bit>
#include <cerrno>

#include "platform/foundation/TrashName.h"
#include "platform/revisions/VolumeStoreReading.h"

namespace cindral {

VolumeStore::Implementation::Update::Update(const Implementation& store, std::span<const FileID> roots, bool journals,
                                            Numbers next)
    : store_(store), roots_(roots), journals_(journals), first_(next), nextEvent_(next.event) {}

// MARK: The objects

std::size_t VolumeStore::Implementation::Update::slotOf(FileID fileID) const {
    const std::size_t mask = slots_.size() - 1;
    const std::uint64_t spread = static_cast<std::uint64_t>(fileID) * 0x9E3779B97F4A7C15;
    auto slot = static_cast<std::size_t>(spread >> (64 - std::countr_zero(slots_.size())));
    while (slots_[slot] != 0 && objects_[slots_[slot] - 1].fileID != fileID) slot = (slot + 1) & mask;
    return slot;
}

void VolumeStore::Implementation::Update::grow() {
    slots_.assign(std::max<std::size_t>(64, slots_.size() * 2), 0);
    for (std::size_t i = 0; i < objects_.size(); ++i) {
        slots_[slotOf(objects_[i].fileID)] = static_cast<std::uint32_t>(i + 1);
    }
}

VolumeStore::Implementation::Update::Object* VolumeStore::Implementation::Update::find(FileID fileID) {
    if (slots_.empty()) return nullptr;
    const std::uint32_t place = slots_[slotOf(fileID)];
    return place != 0 ? &objects_[place - 1] : nullptr;
}

/// An object that is not here yet, as the store has it.
VolumeStore::Implementation::Update::Object& VolumeStore::Implementation::Update::add(FileID fileID,
                                                                                      const PackedRecord* record) {
    if (objects_.size() * 4 >= slots_.size() * 3) grow();
    Object& object = objects_.emplace_back();
    object.fileID = fileID;
    if (record != nullptr) {
        object.wasThere = object.isThere = true;
        object.before = *record;
        char* name = static_cast<char*>(texts_.allocate(std::max<std::size_t>(1, record->name.size()), 1));
        record->name.copy(name, record->name.size());
        object.before.name = {name, record->name.size()};
        object.now = object.before;
    }
    // Only now: it is found by what is in objects_.
    slots_[slotOf(fileID)] = static_cast<std::uint32_t>(objects_.size());
    return object;
}

VolumeStore::Implementation::Update::Object& VolumeStore::Implementation::Update::object(FileID fileID) {
    if (Object* known = find(fileID)) return *known;
    Object* added = nullptr;
    const bool isThere =
        Reader(store_).read(fileID, [&](const PackedRecord& record) { added = &add(fileID, &record); });
    return isThere ? *added : add(fileID, nullptr);
}

// MARK: What happens

DocumentID VolumeStore::Implementation::Update::sight(const ObjectSighting& sighting) {
    Object& seen = object(sighting.fileID);
    const bool isAnother = !seen.isThere || seen.now.birthTime != sighting.birthTime;
    if (sighting.isByIndex && isAnother) return {};
    if (seen.isThere && seen.now.birthTime != sighting.birthTime) {
        // Another object under the number. What the recorder had looked at does not vanish without an event.
        if (seen.now.changeTime != 0) {
            remove(seen);
        } else {
            forget(seen);
        }
    }
    if (!seen.isThere) seen.now = {.birthTime = sighting.birthTime};
    if (seen.now.changeTime == 0) {
        // Where the recorder looked, it alone says where objects are: it journals that they moved.
        if (seen.isThere) placesChanged(seen.now);
        seen.now.parent = sighting.parent;
        seen.now.name = sighting.name;
        seen.now.kind = sighting.kind;
        placesChanged(seen.now);
    }
    seen.isThere = true;
    seen.now.isListed = true;
    if (sighting.wantsDocumentID && seen.now.documentID == DocumentID{}) {
        seen.now.documentID = DocumentID{first_.document + static_cast<std::uint32_t>(given_.size())};
        given_.emplace_back(seen.now.documentID, DocumentRecord{seen.fileID, seen.now.birthTime});
    }
    return seen.now.documentID;
}

namespace {

/// Whether an object's identifier has another form now.
bool changesForm(ObjectKind before, ObjectKind now) {
    return (before == ObjectKind::folder) != (now == ObjectKind::folder);
}

}  // namespace

void VolumeStore::Implementation::Update::put(const IndexedObject& given, std::string_view name) {
    Object& changed = object(given.fileID);
    if (changed.isThere && changed.now.birthTime != given.birthTime) remove(changed);
    const PackedRecord before = changed.now;
    const bool moved = !changed.isThere || !before.isAt(given.parent, name);
    if (changed.isThere && before.isKnownToSomebody() && (moved || changesForm(before.kind, given.kind))) {
        depart(changed, !changesForm(before.kind, given.kind) && name != kTrashName);
    }
    if (changed.isThere && (moved || before.kind != given.kind)) placesChanged(before);
    changed.now = {.parent = given.parent,
                   .birthTime = given.birthTime,
                   .documentID = changed.isThere ? before.documentID : DocumentID{},
                   .kind = given.kind,
                   .isListed = changed.isThere && before.isListed,
                   .isClosed = given.isClosed,
                   .hasOtherNames = given.hasOtherNames,
                   .changeTime = given.changeTime,
                   .size = given.size,
                   .eventID = changed.isThere ? before.eventID : 0,
                   .name = name};
    changed.isThere = true;
    if (moved) placesChanged(changed.now);
    announce(changed);
}

void VolumeStore::Implementation::Update::remove(FileID fileID) {
    remove(object(fileID));
}

void VolumeStore::Implementation::Update::remove(Object& gone) {
    if (!gone.isThere) return;
    if (gone.now.isKnownToSomebody()) depart(gone, /*goesOn=*/false);
    if (const DocumentID itsDocument = gone.now.documentID; itsDocument != DocumentID{}) {
        // Not a document that went to another object since.
        const auto known = document(itsDocument);
        if (known && known->fileID == gone.fileID) changeDocument(itsDocument, gone.fileID, FileID{});
    }
    forget(gone);
}

/// The object is no more; nobody is told.
void VolumeStore::Implementation::Update::forget(Object& gone) {
    placesChanged(gone.now);
    gone.isThere = false;
    gone.now = {};
    for (const auto& [key, name] : names(gone.fileID)) names_[key] = std::nullopt;
}

void VolumeStore::Implementation::Update::touch(FileID fileID) {
    Object& touched = object(fileID);
    if (touched.isThere) announce(touched);
}

void VolumeStore::Implementation::Update::leave(FileID fileID, FileID folder) {
    Object left = object(fileID);
    if (!left.isThere || !left.now.isKnownToSomebody()) return;
    left.now.parent = folder;
    depart(left, /*goesOn=*/true);
}

/// Its event is the newest from now on.
void VolumeStore::Implementation::Update::announce(Object& object) {
    if (journals_) object.now.eventID = nextEvent_++;
}

void VolumeStore::Implementation::Update::depart(const Object& object, bool goesOn) {
    if (!journals_) return;
    const Place place = placeOf(object);
    const Departure departure{.fileID = object.fileID,
                              .documentID = object.now.documentID,
                              .parent = object.now.parent,
                              .objectKind = object.now.kind,
                              .root = place.root.value_or(FileID{}),
                              .name = object.now.name,
                              .path = place.path,
                              .goesOn = goesOn};
    departures_.emplace_back(nextEvent_++, departure.encode());
}

void VolumeStore::Implementation::Update::changeDocument(DocumentID documentID, FileID source, FileID target) {
    if (journals_) documentChanges_.emplace_back(nextEvent_++, DocumentChange{documentID, source, target});
}

std::optional<DocumentRecord> VolumeStore::Implementation::Update::document(DocumentID documentID) const {
    if (const auto found = handedOver_.find(documentID); found != handedOver_.end()) return found->second;
    const auto given = std::ranges::find(given_, documentID, &Overlay::Document::first);
    return given != given_.end() ? given->second : store_.document(documentID);
}

Result<void> VolumeStore::Implementation::Update::handOver(DocumentID documentID, FileID to) {
    Object& target = object(to);
    const auto before = document(documentID);
    if (!target.isThere || !before)
        return KsError::posix(ENOENT).with("message", "a document goes to what is not recorded");
    if (target.now.documentID == documentID) return {};
    Object& source = object(before->fileID);
    if (source.isThere && source.now.documentID == documentID) {
        source.now.documentID = DocumentID{};
        announce(source);
    }
    if (const DocumentID other = target.now.documentID; other != DocumentID{}) changeDocument(other, to, FileID{});
    target.now.documentID = documentID;
    target.now.isListed = true;
    handedOver_[documentID] = {to, target.now.birthTime};
    changeDocument(documentID, before->fileID, to);
    announce(target);
    return {};
}

// MARK: Other names

VolumeStore::Implementation::Names VolumeStore::Implementation::Update::names(FileID fileID) const {
    Names all = store_.names(fileID);
    for (auto at = names_.lower_bound({.fileID = fileID}); at != names_.end() && at->first.fileID == fileID; ++at) {
        if (at->second) {
            all[at->first] = *at->second;
        } else {
            all.erase(at->first);
        }
    }
    return all;
}

std::optional<NameKey> VolumeStore::Implementation::Update::nameKey(const Names& names, FileID parent,
                                                                    std::string_view name, std::uint32_t hash) const {
    const auto found = std::ranges::find_if(names, [&](const auto& entry) {
        return entry.first.parent == parent && entry.first.hash == hash && entry.second == name;
    });
    return found != names.end() ? std::optional(found->first) : std::nullopt;
}

void VolumeStore::Implementation::Update::addName(FileID fileID, FileID parent, std::string_view name) {
    if (!object(fileID).isThere) return;
    const std::uint32_t hash = nameHash(store_.nameHashKey_, name);
    const Names known = names(fileID);
    if (nameKey(known, parent, name, hash)) return;
    NameKey key{.fileID = fileID, .parent = parent, .hash = hash};
    while (known.contains(key)) ++key.index;
    names_[key] = std::string(name);
}

void VolumeStore::Implementation::Update::removeName(FileID fileID, FileID parent, std::string_view name) {
    if (const auto key = nameKey(names(fileID), parent, name, nameHash(store_.nameHashKey_, name))) {
        names_[*key] = std::nullopt;
    }
}

// MARK: Places

/// Where the object is below a root, by the records as they are now.
VolumeStore::Implementation::Update::Place VolumeStore::Implementation::Update::placeOf(const Object& object) {
    if (std::ranges::find(roots_, object.fileID) != roots_.end()) return {.path = "", .root = object.fileID};
    if (!isFileName(object.now.name)) return {};
    // A copy: the object may be gone from where it is when another one is looked at.
    const Place& folder = placeOfFolder(object.now.parent);
    if (!folder.root || folder.path.size() + 1 + object.now.name.size() > Departure::kPathBytesMax) return {};
    std::string path = folder.path;
    if (!path.empty()) path += '/';
    path += object.now.name;
    return {.path = std::move(path), .root = folder.root};
}

const VolumeStore::Implementation::Update::Place& VolumeStore::Implementation::Update::placeOfFolder(FileID fileID) {
    if (placedFolder_ == fileID) return place_;
    placedFolder_ = fileID;
    place_ = {};
    BackwardsPath path;
    FileID at = fileID;
    for (std::size_t depth = 0; depth <= kPathDepthMax; ++depth) {
        if (std::ranges::find(roots_, at) != roots_.end()) {
            place_ = {.path = path.take(), .root = at};
            break;
        }
        const Object& folder = object(at);
        if (!folder.isThere || !isFileName(folder.now.name)) break;
        path.prepend(folder.now.name);
        at = folder.now.parent;
    }
    return place_;
}

/// The object, which may be on somebody's path, is no longer where it was.
void VolumeStore::Implementation::Update::placesChanged(const PackedRecord& record) {
    if (record.kind != ObjectKind::file) placedFolder_.reset();
}

// MARK: Writing

/// Whether the object was given the document that it has with this very update.
bool VolumeStore::Implementation::Update::isGivenNow(const Object& object) const {
    return object.isThere && static_cast<std::uint32_t>(object.now.documentID) >= first_.document &&
           object.now.documentID != DocumentID{} && !given_.empty();
}

void VolumeStore::Implementation::Update::writeTo(BatchWriter& batch) {
    for (Object& object : objects_) {
        if (!object.isChanged()) continue;
        if (!object.isThere) {
            batch.addObjectGone(object.fileID);
            continue;
        }
        object.hash = nameHash(store_.nameHashKey_, object.now.name);
        batch.addObject(object.fileID, isGivenNow(object), object.now);
    }
    for (const auto& [documentID, document] : given_) {
        const Object* holder = find(document.fileID);
        if (holder == nullptr || !holder->isThere || holder->now.documentID != documentID)
            batch.addDocument(LogRecordType::documentGiven, documentID, document);
    }
    for (const auto& [documentID, document] : handedOver_) {
        batch.addDocument(LogRecordType::documentHandedOver, documentID, document);
    }
    for (const auto& [documentID, attributes] : attributes_) {
        batch.add(LogRecordType::attributes, static_cast<std::uint32_t>(documentID), attributes);
    }
    for (const auto& [key, name] : names_) {
        if (name) {
            batch.addOtherName(key, *name);
        } else {
            batch.addOtherNameGone(key);
        }
    }
    for (const auto& [eventID, packed] : departures_) batch.add(LogRecordType::departure, eventID, packed);
    for (const auto& [eventID, change] : documentChanges_) {
        batch.add(LogRecordType::documentChange, eventID, change.encode());
    }
    if (timeMark_) batch.addTimeMark(first_.event, *timeMark_);
}

void VolumeStore::Implementation::Update::writeTo(Overlay& overlay, Counts& counts,
                                                  std::uint64_t forgottenEvent) const {
    std::vector<std::pair<std::uint64_t, const Object*>> announced;
    for (const Object& object : objects_) {
        if (!object.isChanged()) continue;
        const bool stays = object.wasThere && object.isThere && object.before.isAt(object.now.parent, object.now.name);
        // Also a rename within a folder, which changes nothing but while the tables are half written.
        if (object.wasThere && !stays) overlay.addToChildCount(object.before.parent, -1);
        if (object.isThere && !stays) overlay.addToChildCount(object.now.parent, 1);
        counts.objects += object.isThere ? 1 : 0;
        counts.objects -= object.wasThere ? 1 : 0;
        counts.events += object.isThere && object.now.eventID > forgottenEvent ? 1 : 0;
        counts.events -= object.wasThere && object.before.eventID > forgottenEvent ? 1 : 0;
        if (!object.isThere) {
            overlay.putGone(object.fileID);
        } else if (hasNewEvent(object)) {
            announced.emplace_back(object.now.eventID, &object);
        } else {
            overlay.put(object.fileID, object.now, object.hash, false);
        }
    }
    // The overlay has its events in their order.
    std::ranges::sort(announced);
    for (const auto& [eventID, object] : announced) overlay.put(object->fileID, object->now, object->hash, true);
    for (const auto& [documentID, document] : given_) overlay.addDocument(documentID, document);
    for (const auto& [documentID, document] : handedOver_) overlay.handOver(documentID, document);
    for (const auto& [documentID, attributes] : attributes_) overlay.putAttributes(documentID, attributes);
    for (const auto& [key, name] : names_) overlay.putName(key, name);
    for (const auto& [eventID, packed] : departures_) overlay.addDeparture(eventID, packed);
    for (const auto& [eventID, change] : documentChanges_) overlay.addDocumentChange(eventID, change);
    if (timeMark_) overlay.addTimeMark(first_.event, *timeMark_);
    counts.documents += given_.size();
    counts.events += departures_.size() + documentChanges_.size();
}

}  // namespace cindral
