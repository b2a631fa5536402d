#include "platform/revisions/RvStorageManager.h"

#include <fcntl.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <unordered_map>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/revisions/ObjectFinder.h"
#include "platform/revisions/OwnAttributes.h"
#include "platform/revisions/VolumeIndex.h"

namespace cindral {

namespace {

std::atomic<RvStorageManager*> replacement{nullptr};

/// Records the folders of a page that are not themselves among its entries, so that the entries' recorded parents lead
/// to a root.
Result<void> recordFolders(VolumeStore& store, std::vector<const DirectoryReference*>& folders,
                           std::span<const ObjectSighting> sightings) {
    std::ranges::sort(folders);
    folders.erase(std::ranges::unique(folders).begin(), folders.end());
    for (const DirectoryReference* folder : folders) {
        const auto isFolder = [&](const ObjectSighting& sighting) {
            return sighting.fileID == FileID{folder->status.fileID};
        };
        if (folders.size() > 1 && std::ranges::any_of(sightings, isFolder)) continue;
        TRY(ObjectFinder(store, folder->status.deviceID()).recordFolder(store, folder->path, folder->status));
    }
    return {};
}

// An object may move again while it is looked for; one that keeps moving is not found.
constexpr int kSearchesMax = 3;

/// Searches the file system for an object, and records where it is now. A record is a hint: one that can't be written
/// is no reason not to answer.
Result<FoundObject> searchAndRecord(VolumeStore& store, std::uint32_t device, FileID fileID) {
    const ObjectFinder finder(store, device);
    FoundObject found = TRY(finder.find(fileID));
    if (found.isRecorded) return found;
    const Result<void> recorded = finder.record(store, found);
    if (!recorded.ok()) logError("can't record where {} is; {}", found.path(), recorded.error().description());
    return found;
}

/// Whether one of them is of an object that nobody has recorded yet.
Result<bool> hasUnknown(const VolumeStore& store, std::span<const ObjectSighting> sightings) {
    std::vector<FileID> fileIDs;
    fileIDs.reserve(sightings.size());
    for (const ObjectSighting& sighting : sightings) fileIDs.push_back(sighting.fileID);
    bool isUnknown = false;
    TRY(store.indexed(fileIDs, [&](std::size_t i, const IndexedObject* object) {
        const bool isKnown = object != nullptr && object->birthTime == sightings[i].birthTime;
        isUnknown = isUnknown || (!isKnown && !sightings[i].isByIndex);
    }));
    return isUnknown;
}

/// Remembers the system's own attributes of documents that have some, so that they survive a save that drops them.
void rememberAttributes(VolumeStore& store, const KsURL& entry, DocumentID document) {
    entry.loadAttributeNames();
    if (!entry.mayHaveAttributeWithPrefix(own_attributes::kPrefix)) return;
    const std::string name(entry.lastPathComponent());
    const Result<Bytes> attributes = own_attributes::read(entry.directory()->fd.get(), name.c_str());
    if (!attributes.ok() || *attributes == store.attributes(document)) return;
    const Result<void> remembered = store.rememberAttributes(document, *attributes);
    if (!remembered.ok()) logError("can't remember the attributes of {}; {}", name, remembered.error().description());
}

/// Tells the names of objects with several from the one that each is listed under.
class OtherNames {
public:
    explicit OtherNames(const VolumeStore& store) : store_(store) {}

    bool isOne(const KsURL& entry) {
        const Result<FileStatus> status = entry.status();
        if (!status.ok() || status->isDirectory() || status->names < 2) return false;
        const auto record = store_.object(FileID{status->fileID});
        const bool isRecorded = record && record->birthTime == status->birthStamp();
        const bool isRecordedName = isRecorded && record->name == entry.lastPathComponent() &&
                                    record->parent == FileID{entry.directory()->status.fileID};
        if (isRecordedName) return false;
        if (isRecorded && ObjectFinder(store_, status->deviceID()).findByRecords(FileID{status->fileID}).ok())
            return true;
        // Nobody knows it under a name: the first of the page is the one.
        const auto [seen, isNew] = seen_.emplace(status->fileID, entry.path());
        return !isNew && seen->second != entry.path();
    }

private:
    const VolumeStore& store_;
    std::unordered_map<std::uint64_t, std::string> seen_;
};

int errnoOf(const KsError& error) {
    return error.domain() == kKsPOSIXErrorDomain ? static_cast<int>(error.code()) : EIO;
}

}  // namespace

RvStorageManager& RvStorageManager::defaultManager() {
    // Never destroyed: work that ends with the process may still ask.
    static RvStorageManager& manager = *new RvStorageManager;
    RvStorageManager* other = replacement.load(std::memory_order_acquire);
    return other != nullptr ? *other : manager;
}

void RvStorageManager::replaceDefaultManager(RvStorageManager* manager) {
    replacement.store(manager, std::memory_order_release);
}

void RvStorageManager::setStore(std::shared_ptr<VolumeStore> store) {
    KsURL::setDocumentIdentifierSource([store](const FileStatus& status) -> std::uint32_t {
        // A number of another device names something else here.
        if (!RootDirectories::shared().isPublishedDevice(status.device)) return 0;
        const auto object = store ? store->object(FileID{status.fileID}) : std::nullopt;
        return object && object->birthTime == status.birthStamp() ? static_cast<std::uint32_t>(object->documentID) : 0;
    });
    const MutexLock lock(mutex_);
    store_ = std::move(store);
}

std::shared_ptr<VolumeStore> RvStorageManager::store() const {
    const MutexLock lock(mutex_);
    return store_;
}

void RvStorageManager::setCatchUp(CatchUp catchUp) {
    auto shared = catchUp ? std::make_shared<const CatchUp>(std::move(catchUp)) : nullptr;
    const MutexLock lock(mutex_);
    catchUp_ = std::move(shared);
}

bool RvStorageManager::catchUp() const {
    std::shared_ptr<const CatchUp> current;
    {
        const MutexLock lock(mutex_);
        current = catchUp_;
    }
    return current && (*current)();
}

/// Looks for an object where the records say, as of now.
struct RvStorageManager::Search {
    const RvStorageManager& manager;
    VolumeStore& store;
    std::uint32_t device;

    /// `fileIDNow` is asked before each look, because a document may have gone to another object meanwhile. Returns its
    /// error, or ENOENT.
    template <typename FileIDNow>
    Result<FoundObject> find(FileIDNow fileIDNow) const {
        const ObjectFinder finder(store, device);
        for (int search = 0;; ++search) {
            const FileID fileID = TRY(fileIDNow());
            Result<FoundObject> found = finder.findByRecords(fileID);
            if (found.ok()) return found;
            if (search == kSearchesMax) return KsError::posix(ENOENT);
            if (!manager.catchUp()) return searchAndRecord(store, device, TRY(fileIDNow()));
        }
    }
};

std::uint64_t RvStorageManager::resolveDocumentID(std::int64_t documentID, std::uint32_t device) {
    const auto fail = [](int errorNumber) {
        errno = errorNumber;
        return std::uint64_t{0};
    };
    const auto store = this->store();
    if (!store) return fail(EAGAIN);
    if (documentID <= 0 || documentID > UINT32_MAX) return fail(EINVAL);
    const DocumentID wanted{static_cast<std::uint32_t>(documentID)};
    for (int search = 0;; ++search) {
        std::optional<DocumentRecord> document;
        const Result<FoundObject> found = Search{*this, *store, device}.find([&]() -> Result<FileID> {
            document = store->document(wanted);
            if (!document) return KsError::posix(ENOENT);
            return document->fileID;
        });
        if (!found.ok()) return fail(errnoOf(found.error()));
        const auto object = store->object(document->fileID);
        // The number went to another object: the document's own is gone. Or the object took another document over, and
        // is that one since.
        const bool isAnother =
            found->status.birthStamp() != document->birthTime || (object && object->documentID != wanted);
        if (!isAnother) return static_cast<std::uint64_t>(document->fileID);
        // Unless it was handed over between one look and the next.
        if (search == kSearchesMax || store->document(wanted) == document) return fail(ENOENT);
    }
}

std::uint32_t RvStorageManager::documentIDForDescriptor(int fd) {
    const auto fail = [](int errorNumber) {
        errno = errorNumber;
        return std::uint32_t{0};
    };
    const auto store = this->store();
    if (!store) return fail(EAGAIN);
    const Result<FileStatus> status = sys::statx(fd, "");
    if (!status.ok()) return fail(errnoOf(status.error()));
    if (!RootDirectories::shared().isPublishedDevice(status->device)) return fail(EXDEV);

    ObjectSighting sighting;
    sighting.fileID = FileID{status->fileID};
    sighting.birthTime = status->birthStamp();
    sighting.kind = objectKindOf(*status, status->isDirectory());
    sighting.wantsDocumentID = true;
    std::string name;
    auto known = store->object(sighting.fileID);
    if ((!known || known->birthTime != sighting.birthTime) && catchUp()) known = store->object(sighting.fileID);
    if (known && known->birthTime == sighting.birthTime) {
        if (known->documentID != DocumentID{}) return static_cast<std::uint32_t>(known->documentID);
        sighting.parent = known->parent;
        name = known->name;
    } else {
        const Result<std::string> path = sys::pathOfDescriptor(fd);
        if (!path.ok()) return fail(errnoOf(path.error()));
        const KsURL url = KsURL::fileURL(*path);
        name = url.lastPathComponent();
        if (const auto folder = url.deletingLastPathComponent()) {
            const Result<FileStatus> parent = sys::statx(AT_FDCWD, folder->path().c_str());
            if (parent.ok()) sighting.parent = FileID{parent->fileID};
        }
    }
    sighting.name = name;
    const Result<void> identified = store->identify({&sighting, 1});
    if (!identified.ok()) return fail(errnoOf(identified.error()));
    return static_cast<std::uint32_t>(sighting.documentID);
}

Result<std::uint32_t> RvStorageManager::permanentStorageForItem(const KsURL& url, AllocateIfNone allocate) {
    const auto store = this->store();
    if (!store) return KsError::posix(EAGAIN);
    const FileStatus status = TRY(url.status());
    if (!RootDirectories::shared().isPublishedDevice(status.device)) return KsError::posix(EXDEV);
    const auto known = store->object(FileID{status.fileID});
    if (known && known->birthTime == status.birthStamp() && known->documentID != DocumentID{})
        return static_cast<std::uint32_t>(known->documentID);
    if (allocate == AllocateIfNone::no) return KsError::posix(ENOENT);
    const UniqueFd fd = TRY(url.open(O_PATH | O_NOFOLLOW));
    const std::uint32_t documentID = documentIDForDescriptor(fd.get());
    if (documentID == 0) return KsError::errorWithPOSIXCode();
    return documentID;
}

Result<void> RvStorageManager::identify(std::vector<KsURL>& entries) {
    const auto store = this->store();
    if (!store) return KsError::posix(EAGAIN);
    OtherNames otherNames(*store);
    std::erase_if(entries, [&](const KsURL& entry) { return otherNames.isOne(entry); });
    std::vector<ObjectSighting> sightings;
    std::vector<KsURL*> sighted;
    std::vector<const DirectoryReference*> folders;
    sightings.reserve(entries.size());
    sighted.reserve(entries.size());
    for (KsURL& entry : entries) {
        const DirectoryReference& folder = *entry.directory();
        const Result<FileStatus> status = entry.status();
        if (!status.ok() || status->device != folder.status.device) continue;
        // One that is not open is known by its record.
        if (folder.fd && (folders.empty() || folders.back() != &folder)) folders.push_back(&folder);
        ObjectSighting& sighting = sightings.emplace_back();
        sighting.fileID = FileID{status->fileID};
        sighting.birthTime = status->birthStamp();
        sighting.parent = FileID{folder.status.fileID};
        sighting.kind = objectKindOf(*status, entry.isPackage().valueOr(false));
        sighting.name = entry.lastPathComponent();
        sighting.wantsDocumentID = sighting.kind == ObjectKind::file || sighting.kind == ObjectKind::package;
        sighting.isByIndex = entry.wasSeenBefore();
        sighted.push_back(&entry);
    }
    // A new file may be a document that was just saved: the recorder knows, and hands it the number it had.
    if (TRY(hasUnknown(*store, sightings))) (void)catchUp();
    TRY(recordFolders(*store, folders, sightings));
    TRY(store->identify(sightings));
    std::vector<const KsURL*> gone;
    for (std::size_t i = 0; i < sightings.size(); ++i) {
        if (!sightings[i].wantsDocumentID) continue;
        if (sightings[i].isByIndex && sightings[i].documentID == DocumentID{}) {
            gone.push_back(sighted[i]);
            continue;
        }
        sighted[i]->setCachedResourceValue(ResourceKey::documentIdentifier,
                                           std::uint64_t{static_cast<std::uint32_t>(sightings[i].documentID)});
        rememberAttributes(*store, *sighted[i], sightings[i].documentID);
    }
    std::erase_if(entries, [&](const KsURL& entry) { return std::ranges::find(gone, &entry) != gone.end(); });
    return {};
}

Result<std::string> RvStorageManager::pathOfFileID(std::uint64_t fileID, std::uint32_t device, std::size_t sizeMax) {
    const auto store = this->store();
    if (!store) return KsError::posix(EAGAIN);
    const FoundObject found =
        TRY((Search{*this, *store, device}.find([fileID]() -> Result<FileID> { return FileID{fileID}; })));
    std::string path = found.path();
    if (path.size() >= sizeMax) return KsError::posix(ENAMETOOLONG, path);
    return path;
}

}  // namespace cindral
