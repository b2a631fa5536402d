// Trash, put-back and the sweep.

#include <fcntl.h>

#include <cerrno>
#include <utility>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/foundation/TrashName.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselManager.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalAppLibraryManager.h"
#include "provider/LocalTesselKit.h"
#include "provider/Utilities.h"
#include "provider/fs/FSDirectoryEnumerator.h"

namespace cindral {

namespace {

// Deletions of a sweep that are under way at the same time.
constexpr std::uint64_t kSweepDeletionsMax = 8;

/// The trash folder's path for an item's: up to and including the first "Documents". Empty where there is none.
std::string trashPath(std::string_view path) {
    for (std::size_t begin = 0; begin < path.size();) {
        const std::size_t end = std::min(path.find('/', begin), path.size());
        if (path.substr(begin, end - begin) == kDocumentsName)
            return std::string(path.substr(0, end)).append("/").append(kTrashName);
        begin = end + 1;
    }
    return {};
}

/// The trash of an item, in the item's own root; the host's error otherwise.
Result<KsURL> trashURL(const KsURL& url) {
    const std::string path = trashPath(url.path());
    if (path.empty()) {
        logError("no Documents directory found in path \"{}\"", url.path());
        return tsInvalidParameterError("sourceURL", url.absoluteString());
    }
    // A root further down than a folder that happens to be called Documents: nothing is made outside of it.
    const auto root = RootDirectories::shared().rootHolding(path);
    if (!root || root != RootDirectories::shared().rootHolding(url.path())) {
        logError("can't build trash URL from components \"{}\"", path);
        return tsInvalidParameterError("trashComponents", path);
    }
    KsURL trash = KsURL::fileURL(path);
    logDebug("trash is located at \"{}\"", trash.description());
    return trash;
}

std::optional<KsError> writeAttribute(const MeantFile& file, std::string_view name, const std::optional<Bytes>& value) {
    const Result<void> written = ts_withReadWriteAccess(file, [&](int fd) -> Result<void> {
        if (auto error = setXattr(fd, value, name)) return *std::move(error);
        return {};
    });
    return written.ok() ? std::nullopt : std::optional(written.error());
}

/// The error, after an error line, when it can't be set.
std::optional<KsError> setTrashDate(const MeantFile& file, const KsDate& date) {
    const std::string url = file.url.description();
    logDebug("setting trash date on {}", url);
    auto error = writeAttribute(file, kXattrTrashDateName, keyed_archive::archive(date));
    if (error) logError("can't set {} of {}; {}", kXattrTrashDateName, url, error->description());
    return error;
}

/// Whether nobody could ever give it an attribute, of those that this process is: not that there is no room just now.
bool isRefusedForGood(const KsError& error) {
    return error.isPosix(EACCES) || error.isPosix(EPERM) || error.isPosix(ENOTSUP);
}

/// The root of the app library that holds the URL, the storage among them.
struct Library {
    std::string name;
    KsURL root;
};
std::optional<Library> libraryHolding(const KsURL& url) {
    const auto proxy = RoBundleProxy::proxyWithContaining(url);
    if (!proxy || !proxy->dataContainerURL()) return std::nullopt;
    return Library{proxy->localizedName(), proxy->dataContainerURL()->appendingPathComponent(kDocumentsName)};
}

void setPutBack(const KsURL& former, const KsURL& url) {
    logDebug("setting putback string on {}", url.description());
    const auto library = libraryHolding(former);
    if (!library) return logError("couldn't find app library for {}", former.description());
    const std::string path = properURL(former).path();
    const std::string base = properURL(library->root).path();
    if (!path.starts_with(base + "/"))
        return logError("could't compute putback string (path: {}, basePath: {})", path, base);
    const std::string text = path.substr(base.size() + 1);
    logDebug("setting putback '{}' on {}", text, url.description());
    if (const auto error = writeAttribute(url, kXattrTrashPutBackName, keyed_archive::archive(text)))
        logError("couldn't set putback xattr ({})", error->description());
}

bool isReachableFolder(const KsURL& url) {
    return RootDirectories::shared().rootHolding(url.path()) != nullptr && url.open(O_PATH | O_DIRECTORY).ok();
}

}  // namespace

void LocalTesselKit::trashItemWithIdentifier(const TesselItemIdentifier& identifier, ItemCompletion completion) {
    const LogSection section("trash item \"{}\"", identifier);
    attempt([identifier, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> file = find(identifier, Lookup::lenient);
        if (!file.ok()) return completion(file.error());
        const Result<KsURL> trash = trashURL(file->url);
        if (!trash.ok()) return completion(trash.error());
        // Nothing to be done, and where it came from is not to be forgotten.
        if (file->url.deletingLastPathComponent() == *trash) return completion(itemAtURL(file->url));
        const Result<void> made = file_operations::makeFolderUnlessThere(*trash);
        if (!made.ok()) return completion(made.error());
        ts_trashUnderFolder(*file, *trash, [identifier, file = *file, again, completion](const Result<KsURL>& trashed) {
            if (trashed.ok()) {
                (void)setTrashDate(*trashed, KsDate::now());
                setPutBack(file.url, *trashed);
                return completion(itemAtURL(*trashed));
            }
            if (!hasGone(trashed.error(), file)) return completion(translated(trashed.error()));
            if (!again()) completion(missingItem(identifier, Lookup::lenient));
        });
    });
}

std::shared_ptr<TesselProgress> LocalTesselKit::untrashItemWithIdentifier(
    const TesselItemIdentifier& identifier, const std::optional<TesselItemIdentifier>& parent,
    ItemCompletion completion) {
    const LogSection section("untrash item \"{}\"", identifier);
    auto progress = std::make_shared<TesselProgress>();
    attempt([identifier, parent, progress, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> file = find(identifier, Lookup::lenient);
        if (!file.ok()) return completion(file.error());
        const auto item = fetchItem(identifier);
        if (!item.ok()) return completion(item.error());
        if (!(*item)->isTrashed()) {
            logDebug("item is not in trash");
            return completion(tsInvalidParameterError("identifier", identifier));
        }
        const std::optional<KsURL> folder = destinationOfUntrash(**item, parent);
        if (!folder) {
            logDebug("can't compute valid parent URL for {}", file->url.description());
            return completion(tsInvalidParameterError("parent", parent.value_or("")));
        }
        ts_reparentUnderFolder(
            *file, *folder, Bouncing::isAllowed,
            [identifier, file = *file, again, completion](const Result<KsURL>& restored) {
                if (restored.ok()) return completion(withoutTrashDate(*restored));
                if (!hasGone(restored.error(), file)) return completion(translated(restored.error()));
                if (!again()) completion(missingItem(identifier, Lookup::lenient));
            },
            progress);
    });
    return progress;
}

/// What was put back, as it is now.
Result<std::shared_ptr<const TesselItem>> LocalTesselKit::withoutTrashDate(const KsURL& restored) {
    logDebug("removing trash date xattr");
    if (const auto error = writeAttribute(restored, kXattrTrashDateName, std::nullopt))
        logError("can't remove {} of {}; {}", kXattrTrashDateName, restored.description(), error->description());
    return itemAtURL(restored);
}

std::optional<KsURL> LocalTesselKit::destinationOfUntrash(const LocalItem& item,
                                                          const std::optional<TesselItemIdentifier>& parent) {
    if (parent) {
        const std::optional<KsURL> requested = urlForItemWithPersistentIdentifier(*parent);
        if (requested && !isInTrash(*requested)) return requested;
        if (requested)
            logDebug("can't use provided parent item {} because it's trashed; try the putback location", *parent);
    }
    // The record names the item; it goes back to the folder that held it.
    if (const std::optional<KsURL>& former = item.putBackURL()) {
        const std::optional<KsURL> folder = former->deletingLastPathComponent();
        if (folder && !isInTrash(*folder) && isReachableFolder(*folder)) return folder;
        logDebug("putback url is not reachable; {}", former->description());
    }
    const auto library = libraryHolding(*item.fileURL());
    if (!library || !isReachableFolder(library->root)) return std::nullopt;
    logDebug("{}'s root as recover location", library->name);
    return library->root;
}

namespace {

/// Whether an item was put back or deleted by somebody else: then there is nothing to be done any more.
bool isGoneItem(const KsError& error) {
    return error.isPosix(ESTALE) || error.is(kKsGeneralErrorDomain, kKsFileNoSuchFileError);
}

/// One run over the trash folders. Kept by its deletions until the last has answered.
class Sweep : public std::enable_shared_from_this<Sweep> {
public:
    Sweep(const KsDate& reference, TesselExtension::Completion completion)
        : section_(new LogSection("remove trashed items older than {}", reference.rfc3339())),
          reference_(reference),
          completion_(std::move(completion)) {}

    void run() {
        std::vector<KsURL> roots{TesselManager::defaultManager().documentStorageURL()};
        for (const KsURL& library : CdlAppLibraryManager::rootURLsForAppLibraries()) roots.push_back(library);
        for (const KsURL& root : roots) visit(root.appendingPathComponent(kTrashName));
        logDebug("wait until all deletions are complete");
        deletions_.wait();
        // One for the process, which work may outlast.
        static SerialQueue& notifier = *new SerialQueue("cindral.auto-delete.notifier");
        notifier.async([self = shared_from_this()] { self->complete(); });
    }

private:
    void visit(const KsURL& trash) {
        const Result<UniqueFd> there = trash.open(O_PATH | O_DIRECTORY);
        if (!there.ok() && there.error().isPosix(ENOENT)) return;  // Nothing was ever trashed there.
        // Listed to the end before anything is deleted: what is not read yet must not move.
        std::vector<KsURL> entries;
        EnumeratorOptions options;
        options.urls = {trash};
        FSDirectoryEnumerator enumerator;
        const Result<void> listed = enumerator.enumerate(options, [&](KsURL entry) -> Result<void> {
            entries.push_back(KsURL::fileURL(entry.path()));
            return {};
        });
        if (!listed.ok()) fail(listed.error());
        if (const auto& error = enumerator.openError()) fail(*error);
        for (const KsURL& entry : entries) visitEntry(entry);
    }

    void visitEntry(const KsURL& url) {
        const Result<FileStatus> status = url.status();
        if (!status.ok()) return;  // Gone already.
        const std::optional<KsDate> trashed = trashDate(url, *status);
        if (!trashed || !(*trashed < reference_)) return;
        KsURL asked = url;
        const auto identifier = itemIdentifier(asked);
        if (!identifier) return logError("identifier lookup failed for URL \"{}\"", url.description());
        logDebug("{} was trashed before reference date, let's remove it", url.description());
        slots_.wait();
        deletions_.enter();
        // Only the very object that was looked at: somebody may put it back meanwhile, and trash another of its name. And
        // nobody asked for just this one to be deleted: with certainty.
        ts_deleteWithCompletionHandler(
            MeantFile(url, status->identity()),
            [self = shared_from_this(), identifier = *identifier](const std::optional<KsError>& error) {
                if (error && !isGoneItem(*error)) {
                    logError("can't remove item {}; {}", identifier, error->description());
                    self->fail(*error);
                }
                self->slots_.signal();
                self->deletions_.leave();
            },
            std::make_shared<TesselProgress>(), Certainty::isWanted);
    }

    /// None where there was none, and one was given now.
    static std::optional<KsDate> trashDate(const KsURL& url, const FileStatus& status) {
        // What can't bear attributes, or may not be given any, would never go: being trashed was the last that changed it.
        // Anything else is kept until it can be given a date.
        if (!status.isRegular() && !status.isDirectory()) return status.changeTime;
        const auto value = initWithValueOfXattr(kXattrTrashDateName, url);
        const auto date = value ? keyed_archive::unarchiveDate(*value) : std::nullopt;
        if (date) return date;
        if (value) {
            logDebug("can't unarchive xattr data for URL \"{}\"; set current date", url.description());
        } else {
            logDebug("can't find trash date for URL \"{}\"; set current date", url.description());
        }
        const auto error = setTrashDate(MeantFile(url, status.identity()), KsDate::now());
        return error && isRefusedForGood(*error) ? std::optional(status.changeTime) : std::nullopt;
    }

    void fail(const KsError& error) {
        const MutexLock lock(mutex_);
        if (!error_) error_ = error;
    }

    void complete() {
        std::optional<KsError> error;
        {
            const MutexLock lock(mutex_);
            error = error_;
        }
        section_.reset();
        completion_(error);
    }

    std::unique_ptr<LogSection> section_;  ///< until all deletions have answered
    const KsDate reference_;
    const TesselExtension::Completion completion_;
    DispatchSemaphore slots_{kSweepDeletionsMax};
    DispatchGroup deletions_;
    Mutex mutex_;
    std::optional<KsError> error_ GUARDED_BY(mutex_);
};

}  // namespace

void LocalTesselKit::removeTrashedItemsOlderThanDate(const KsDate& date, Completion completion) {
    dispatchAsync([sweep = std::make_shared<Sweep>(date, std::move(completion))] { sweep->run(); });
}

}  // namespace cindral
