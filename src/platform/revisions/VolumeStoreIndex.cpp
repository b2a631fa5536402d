#include <algorithm>
#include <cerrno>
#include <unordered_set>

#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStoreReading.h"

// The directory index: what changes it, and how it is read.

namespace cindral {

// MARK: Changing

namespace {

using Kind = IndexChanges::Operation::Kind;

}  // namespace

Result<std::uint64_t> VolumeStore::Implementation::apply(const IndexChanges& changes, std::span<const FileID> roots) {
    const auto& operations = changes.operations();
    for (const auto& operation : operations) {
        if (const auto name = changes.nameOf(operation); !canBeName(name))
            return KsError::posix(EINVAL).with("name", std::string(name));
    }
    const MutexLock lock(writerMutex_);
    if (!std::ranges::equal(roots_, roots)) roots_.assign(roots.begin(), roots.end());
    if (operations.empty()) return numbers_->currentEvent();
    TRY(waitForRoom());
    Update update = beginUpdate(roots_, changes.journal() == IndexChanges::Journal::yes);
    TRY(noticed(update.load(operations.size(), [&](std::size_t i) { return operations[i].object.fileID; })));
    for (const auto& operation : operations) {
        const IndexedObject& object = operation.object;
        const std::string_view name = changes.nameOf(operation);
        switch (operation.kind) {
            case Kind::put: update.put(object, name); break;
            case Kind::remove: update.remove(object.fileID); break;
            case Kind::touch: update.touch(object.fileID); break;
            case Kind::addName: update.addName(object.fileID, object.parent, name); break;
            case Kind::removeName: update.removeName(object.fileID, object.parent, name); break;
            case Kind::leave: update.leave(object.fileID, object.parent); break;
            case Kind::handOver: TRY(update.handOver(operation.document, object.fileID)); break;
        }
    }
    TRY(commit(update));
    return numbers_->currentEvent();
}

Result<void> VolumeStore::Implementation::rememberAttributes(DocumentID document, ByteView attributes) {
    if (attributes.size() > kAttributesBytesMax) return KsError::posix(EINVAL);
    const MutexLock lock(writerMutex_);
    if (std::ranges::equal(this->attributes(document), attributes)) return {};
    TRY(waitForRoom());
    Update update = beginUpdate({}, false);
    update.putAttributes(document, attributes);
    return commit(update);
}

Bytes VolumeStore::Implementation::attributes(DocumentID document) const {
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {static_cast<const Overlay*>(active_.get()), frozen_.get()}) {
            if (overlay == nullptr) continue;
            if (const auto found = overlay->attributes().find(document); found != overlay->attributes().end())
                return found->second;
        }
    }
    const ObjectTables::Snapshot snapshot(*tables_);
    const auto found = snapshot.attributes(document);
    return found ? Bytes(found->begin(), found->end()) : Bytes();
}

// MARK: Objects

/// An object with a name of its own.
struct VolumeStore::Implementation::FoundChild {
    FoundChild() = default;
    FoundChild(FileID fileID, const PackedRecord& record) { set(fileID, record); }

    void set(FileID fileID, const PackedRecord& record) {
        object = indexedObject(fileID, record);
        name = record.name;
    }
    const IndexedObject& named() {
        object.name = name;
        return object;
    }

    IndexedObject object;
    std::string name;
};

bool VolumeStore::Implementation::indexed(FileID fileID, const ObjectReceiver& receive) const {
    FoundChild found;
    if (!Reader(*this).read(fileID, [&](const PackedRecord& record) { found.set(fileID, record); })) return false;
    receive(found.named());
    return true;
}

Result<void> VolumeStore::Implementation::indexed(
    std::span<const FileID> fileIDs, const std::function<void(std::size_t, const IndexedObject*)>& receive) const {
    // Copies, because some are read under the lock, which nobody is called under.
    std::vector<std::pair<std::size_t, std::optional<FoundChild>>> found;
    for (std::size_t begin = 0; begin < fileIDs.size(); begin += kLookupsAtOnceMax) {
        const auto some = fileIDs.subspan(begin, std::min(kLookupsAtOnceMax, fileIDs.size() - begin));
        found.clear();
        TRY(noticed(lookUp(
            some.size(), [&](std::size_t i) { return some[i]; },
            [&](std::size_t i, const PackedRecord* record) {
                auto& place = found.emplace_back(begin + i, std::nullopt);
                if (record != nullptr) place.second.emplace(some[i], *record);
            })));
        for (auto& [place, object] : found) receive(place, object ? &object->named() : nullptr);
    }
    return {};
}

// MARK: Children

/// Each once: while the overlays are written, an object may be met in several places.
class VolumeStore::Implementation::FoundChildren {
public:
    void add(FileID fileID, const PackedRecord& record) {
        const auto isSame = [fileID](const FoundChild& child) { return child.object.fileID == fileID; };
        if (std::ranges::none_of(children_, isSame)) children_.emplace_back(fileID, record);
    }
    bool tell(const ObjectReceiver& receive) {
        for (FoundChild& child : children_) receive(child.named());
        return !children_.empty();
    }

private:
    std::vector<FoundChild> children_;
};

bool VolumeStore::Implementation::childrenNamed(FileID parent, std::string_view name,
                                                const ObjectReceiver& receive) const {
    const std::uint32_t hash = nameHash(nameHashKey_, name);
    FoundChildren found;
    findUnsavedChildren(parent, name, hash, found);
    findSavedChildren(parent, name, hash, found);
    findByOtherName(parent, name, hash, found);
    return found.tell(receive);
}

void VolumeStore::Implementation::findUnsavedChildren(FileID parent, std::string_view name, std::uint32_t hash,
                                                      FoundChildren& found) const {
    const auto take = [&](FileID fileID, const PackedRecord& record) {
        if (record.name == name) found.add(fileID, record);
        return false;  // There may be more.
    };
    const MutexLock lock(mutex_);
    active_->findChild(parent, hash, take);
    if (!frozen_) return;
    const Overlay& newer = *active_;
    frozen_->findChild(parent, hash, [&](FileID fileID, const PackedRecord& record) {
        return !newer.find(fileID).isKnown && take(fileID, record);
    });
}

void VolumeStore::Implementation::findSavedChildren(FileID parent, std::string_view name, std::uint32_t hash,
                                                    FoundChildren& found) const {
    const auto candidates = noticed(ObjectTables::Snapshot(*tables_).childrenWithHash(parent, hash));
    if (!candidates.ok()) return;
    Reader reader(*this);
    for (const FileID fileID : *candidates) {
        reader.read(fileID, [&](const PackedRecord& record) {
            if (record.isAt(parent, name)) found.add(fileID, record);
        });
    }
}

void VolumeStore::Implementation::findByOtherName(FileID parent, std::string_view name, std::uint32_t hash,
                                                  FoundChildren& found) const {
    for (const NameKey& key : namesWithHash(parent, hash)) {
        if (nameOf(key) != name) continue;
        Reader(*this).read(key.fileID, [&](const PackedRecord& record) { found.add(key.fileID, record); });
    }
}

Result<void> VolumeStore::Implementation::children(FileID parent, const ObjectReceiver& receive) const {
    // First those that an overlay knows to have come here, whatever the tables say of them.
    std::vector<FileID> arrived;
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {static_cast<const Overlay*>(active_.get()), frozen_.get()}) {
            const auto* arrivals = overlay != nullptr ? overlay->arrivals(parent) : nullptr;
            if (arrivals != nullptr) arrived.insert(arrived.end(), arrivals->begin(), arrivals->end());
        }
    }
    std::ranges::sort(arrived);
    arrived.erase(std::ranges::unique(arrived).begin(), arrived.end());
    const auto tell = [&](std::size_t, const IndexedObject* object) {
        if (object != nullptr && object->parent == parent) receive(*object);
    };
    TRY(indexed(arrived, tell));

    const ObjectTables::Snapshot snapshot(*tables_);
    std::vector<FileID> others;
    Result<void> told;
    TRY(noticed(snapshot.children(parent, [&](std::span<const FileID> some) {
        others.clear();
        std::ranges::copy_if(some, std::back_inserter(others),
                             [&](FileID fileID) { return !std::ranges::binary_search(arrived, fileID); });
        if (told.ok()) told = indexed(others, tell);
    })));
    return told;
}

std::uint64_t VolumeStore::Implementation::childCount(FileID parent) const {
    while (true) {
        std::int64_t difference = 0;
        std::optional<std::uint64_t> saved;
        std::uint64_t frozenCountSaved = 0;
        bool isBeingWritten = false;
        {
            const MutexLock lock(mutex_);
            frozenCountSaved = frozenCountSaved_;
            difference = active_->childCountDifference(parent);
            isBeingWritten = frozenChildCounts_ != nullptr;
            if (isBeingWritten) {
                const auto found = frozenChildCounts_->find(parent);
                if (found != frozenChildCounts_->end()) saved = found->second;
            } else if (frozen_) {
                difference += frozen_->childCountDifference(parent);
            }
        }
        if (saved) return *saved + static_cast<std::uint64_t>(difference);
        const std::uint64_t count = ObjectTables::Snapshot(*tables_).childCount(parent);
        const MutexLock lock(mutex_);
        // What was read of the tables is of the same moment.
        const bool isSame = frozenCountSaved == frozenCountSaved_ && isBeingWritten == (frozenChildCounts_ != nullptr);
        if (isSame) return count + static_cast<std::uint64_t>(difference);
    }
}

// MARK: Other names

VolumeStore::Implementation::Names VolumeStore::Implementation::names(FileID fileID) const {
    std::map<NameKey, std::optional<std::string>> unsaved;
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {static_cast<const Overlay*>(active_.get()), frozen_.get()}) {
            if (overlay == nullptr) continue;
            const auto& all = overlay->names();
            for (auto at = all.lower_bound({.fileID = fileID}); at != all.end() && at->first.fileID == fileID; ++at) {
                unsaved.insert(*at);
            }
        }
    }
    Names found;
    const ObjectTables::Snapshot snapshot(*tables_);
    if (snapshot.hasNames()) {
        const auto saved = snapshot.names(fileID);
        if (saved.ok()) found.insert(saved->begin(), saved->end());
    }
    for (auto& [key, name] : unsaved) {
        if (name) {
            found[key] = std::move(*name);
        } else {
            found.erase(key);
        }
    }
    return found;
}

std::vector<NameKey> VolumeStore::Implementation::namesWithHash(FileID parent, std::uint32_t hash) const {
    std::vector<NameKey> found;
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {static_cast<const Overlay*>(active_.get()), frozen_.get()}) {
            if (overlay == nullptr) continue;
            const auto& places = overlay->namePlaces();
            for (auto at = places.lower_bound({parent, hash, FileID{}, std::uint16_t{0}}); at != places.end(); ++at) {
                const auto& [itsParent, itsHash, fileID, index] = *at;
                if (itsParent != parent || itsHash != hash) break;
                found.push_back({.fileID = fileID, .parent = parent, .hash = hash, .index = index});
            }
        }
    }
    const ObjectTables::Snapshot snapshot(*tables_);
    if (!snapshot.hasNames()) return found;
    if (const auto saved = snapshot.namesWithHash(parent, hash); saved.ok())
        found.insert(found.end(), saved->begin(), saved->end());
    return found;
}

/// None when the name is no more.
std::optional<std::string> VolumeStore::Implementation::nameOf(const NameKey& key) const {
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {static_cast<const Overlay*>(active_.get()), frozen_.get()}) {
            if (overlay == nullptr) continue;
            if (const auto found = overlay->names().find(key); found != overlay->names().end()) return found->second;
        }
    }
    const ObjectTables::Snapshot snapshot(*tables_);
    const auto name = snapshot.name(key);
    return name ? std::optional<std::string>(*name) : std::nullopt;
}

std::vector<VolumeStore::Name> VolumeStore::Implementation::otherNames(FileID fileID) const {
    FoundChild object;
    std::vector<Name> found;
    if (!Reader(*this).read(fileID, [&](const PackedRecord& record) { object.set(fileID, record); })) return found;
    for (auto& [key, name] : names(fileID)) {
        // What was its other name may have become its recorded one.
        if (key.parent == object.object.parent && name == object.name) continue;
        found.push_back({key.parent, name});
    }
    return found;
}

}  // namespace cindral
