#include "provider/LocalFileEnumerator.h"

#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <utility>

#include "platform/eventstream/EventStream.h"
#include "platform/foundation/InternedString.h"
#include "platform/foundation/Log.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselErrors.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalItem.h"
#include "provider/LocalTesselKitError.h"
#include "provider/fs/FSDirectoryEnumerator.h"
#include "provider/fs/FSEventReader.h"
#include "provider/fs/FSGatherWitness.h"
#include "provider/fs/FSListingPositions.h"

namespace cindral {

namespace {

constexpr std::string_view kTrashName = ".Trash";

bool listsEverythingBelow(const TesselItemIdentifier& container) {
    return container == kTesselWorkingSetContainerItemIdentifier ||
           container == kTesselAllDirectoriesContainerItemIdentifier;
}

EnumeratorOptions enumeratorOptions(const TesselItemIdentifier& container, const std::vector<KsURL>& urls,
                                    std::uint64_t offset) {
    EnumeratorOptions options;
    options.urls = urls;
    options.recursively = listsEverythingBelow(container);
    options.offset = offset;
    options.limit = kGatherPageEntriesMax;
    options.directoryEnumerationOptionsFor = [](const KsURL&) {
        return DirectoryEnumerationOptions::skipsPackageDescendants;
    };
    options.positions = &FSListingPositions::shared();
    options.positionsKey = options.recursively ? "below" : "in";
    for (const KsURL& url : urls) {
        options.positionsKey += '\0';  // In no path.
        options.positionsKey += url.path();
    }
    return options;
}

/// Below a root, what is mounted from elsewhere has numbers that name nothing here.
bool isOfAnotherDevice(const KsURL& entry, const FileStatus& status) {
    if (status.device == entry.directory()->status.device) return false;
    if (RootDirectories::shared().noteLeftOut(entry.path(), "it is on another device than the storage")) {
        logInfo("leaving out {}; it is on another device than the storage", entry.description());
    }
    return true;
}

}  // namespace

struct LocalFileEnumerator::FolderContext {
    const DirectoryReference* folder = nullptr;
    std::optional<TesselItemIdentifier> identifier;
    InternedString bundleIdentifier;
};

/// The contexts of a page's folders, each worked out once.
class LocalFileEnumerator::FolderContexts {
public:
    const FolderContext& of(const KsURL& entry) {
        const DirectoryReference* folder = entry.directory().get();
        // Entries of one folder mostly follow each other.
        const auto found = std::ranges::find(contexts_.rbegin(), contexts_.rend(), folder, &FolderContext::folder);
        if (found != contexts_.rend()) return *found;
        FolderContext context;
        context.folder = folder;
        KsURL url = KsURL::of(*folder);
        context.identifier = itemIdentifier(url);
        if (const auto proxy = RoBundleProxy::proxyWithContaining(entry))
            context.bundleIdentifier = InternedString(proxy->bundleIdentifier());
        return contexts_.emplace_back(std::move(context));
    }

private:
    std::vector<FolderContext> contexts_;
};

std::shared_ptr<LocalFileEnumerator> LocalFileEnumerator::initWithContainer(TesselItemIdentifier container,
                                                                            std::vector<KsURL> urls) {
    if (urls.empty()) {
        std::fputs("can't create enumerator for an empty list of URLs\n", stderr);
        std::abort();
    }
    return std::shared_ptr<LocalFileEnumerator>(new LocalFileEnumerator(std::move(container), std::move(urls)));
}

LocalFileEnumerator::LocalFileEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls)
    : container_(std::move(container)),
      enumeratedItemURL_(urls.size() == 1 ? std::optional(urls.front()) : std::nullopt),
      urls_(std::move(urls)) {}

std::string LocalFileEnumerator::enumeratedItemName() const {
    return enumeratedItemURL_ ? std::string(enumeratedItemURL_->lastPathComponent()) : container_;
}

void LocalFileEnumerator::enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                                    const TesselPage& page) {
    FSChangeToken token;
    std::string pageName;
    if (page == tesselInitialPageSortedByDate()) {
        pageName = "initialPageSortedByDate";
    } else if (page == tesselInitialPageSortedByName()) {
        pageName = "initialPageSortedByName";
    } else {
        const std::optional<FSChangeToken> decoded = FSChangeToken::decode(page);
        if (!decoded) {
            logError("can't create change token from anchor data, resetting");
            observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
            return;
        }
        token = *decoded;
        pageName = token.description();
    }
    const LogSection section("enumerate items for {} with page {}", enumeratedItemName(), pageName);
    gather(*observer, token);
}

void LocalFileEnumerator::gather(TesselEnumerationObserver& observer, FSChangeToken incoming) {
    std::optional<FSChangeToken> token = gatherToken(observer, incoming);
    if (!token) return;

    std::vector<KsURL> entries;
    entries.reserve(kGatherPageEntriesMax);
    FSDirectoryEnumerator enumerator;
    const Result<void> listed = enumerator.enumerate(enumeratorOptions(container_, urls_, token->offset),
                                                     [&entries](KsURL entry) -> Result<void> {
                                                         entries.push_back(std::move(entry));
                                                         return {};
                                                     });
    if (!listed.ok()) return observer.finishEnumeratingWithError(listed.error());
    // A container that is one folder is nothing without it; of several, each is listed as far as it can be.
    if (urls_.size() == 1 && enumerator.openError()) {
        return observer.finishEnumeratingWithError(*enumerator.openError());
    }

    const std::uint64_t reached = enumerator.counter();
    const bool isFull = reached >= token->offset && reached - token->offset == kGatherPageEntriesMax;
    const Result<void> witnessed = witness(*token, entries, isFull);
    if (!witnessed.ok()) return observer.finishEnumeratingWithError(witnessed.error());
    Result<TesselItems> items = itemsOf(std::move(entries));
    if (!items.ok()) return observer.finishEnumeratingWithError(items.error());
    observer.didEnumerateItems(std::move(*items));

    if (reached < token->offset) {
        logInfo("enumerator returned an offset ({}) smaller than the initial offset {}", reached, token->offset);
        return observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    if (isFull) {
        token->offset = reached;
        return observer.finishEnumeratingUpToPage(token->encode());
    }
    logDebug("gather phase finished for {}", urls_.front().description());
    observer.finishEnumeratingUpToPage(std::nullopt);
}

/// Keeps what the page has seen, for the question whether the next may follow. A listing that ends with its first page
/// needs no witness.
Result<void> LocalFileEnumerator::witness(FSChangeToken& token, const std::vector<KsURL>& entries, bool isFull) const {
    const bool isFirst = token.offset == 0;
    if (isFirst && !isFull) return {};
    std::vector<const DirectoryReference*> folders;
    for (const KsURL& entry : entries) {
        if (folders.empty() || folders.back() != entry.directory().get()) folders.push_back(entry.directory().get());
    }
    if (isFirst) {
        token.streamEventID = TRY(FSGatherWitness::shared().begin(urls_, folders));
    } else {
        FSGatherWitness::shared().sawFolders(urls_, token.streamEventID, folders);
    }
    return {};
}

std::optional<FSChangeToken> LocalFileEnumerator::gatherToken(TesselEnumerationObserver& observer,
                                                              FSChangeToken token) {
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for {}", urls_.front().description());
        observer.finishEnumeratingWithError(errorFor(LocalTesselKitError::unableToGetDeviceUUID));
        return std::nullopt;
    }
    if (token.offset > 0 && token.deviceUUID != *volume) {
        logInfo("device UUID changed ({} -> {})", token.deviceUUID.string(), volume->string());
        token.offset = 0;
    } else if (token.offset > 0) {
        if (!mayResume(observer, token)) return std::nullopt;
        return token;
    } else {
        logDebug("start gather phase");
    }
    token.version = FSChangeToken::kCurrentVersion;
    token.deviceUUID = *volume;
    token.streamEventID = EventStream::currentEventID();
    return token;
}

bool LocalFileEnumerator::mayResume(TesselEnumerationObserver& observer, const FSChangeToken& token) const {
    logDebug("resume gather phase at offset {}", token.offset);
    const FSEventReaderGatherPhaseResumeStatus status = FSEventReader::canResumeGatherPhase(urls_, token.streamEventID);
    if (std::holds_alternative<CanResume>(status)) {
        logDebug("safe to resume gather phase from FSEventID {}", token.streamEventID);
        return true;
    }
    if (const auto* deletion = std::get_if<DeletionOccurred>(&status)) {
        logInfo("deletion of {} requires to re-gather from scratch", deletion->path);
    } else {
        logInfo("can't replay historical FSEvents, need to re-start gather phase from scratch");
    }
    observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    return false;
}

Result<TesselItems> LocalFileEnumerator::itemsOf(std::vector<KsURL> entries) const {
    const bool foldersOnly = container_ == kTesselAllDirectoriesContainerItemIdentifier;
    std::optional<KsError> unreadable;
    std::erase_if(entries, [&](const KsURL& entry) {
        if (entry.lastPathComponent() == kTrashName) return true;
        const Result<FileStatus> status = entry.status();
        if (!status.ok() && !status.error().isPosix(ENOENT)) {
            logError("can't read \"{}\"; {}", entry.path(), status.error().description());
            unreadable = status.error().with("path", entry.path());
        }
        return !status.ok() || isOfAnotherDevice(entry, *status) || (foldersOnly && !entry.ts_isFolder());
    });
    // A folder that may be listed but not searched has entries of which nothing can be told: that is no empty folder.
    // Among others, it is one that can't be read.
    if (entries.empty() && unreadable && !listsEverythingBelow(container_)) return *unreadable;
    // Without document IDs there are no items: better no page than one that misses files.
    TRY(RvStorageManager::defaultManager().identify(entries));

    TesselItems items;
    items.reserve(entries.size());
    FolderContexts contexts;
    for (KsURL& entry : entries) {
        const FolderContext& context = contexts.of(entry);
        LocalItem::Customs customs;
        customs.parentItemID = context.identifier;
        customs.bundleIdentifier = context.bundleIdentifier;
        if (auto item = LocalItem::initWithURL(std::move(entry), std::move(customs))) items.push_back(std::move(item));
    }
    return items;
}

void LocalFileEnumerator::enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                                      const TesselSyncAnchor& anchor) {
    const std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
    if (!token) {
        logError("can't create change token from anchor data, resetting");
        return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    const LogSection section("enumerate changes for {} {}", enumeratedItemName(), token->description());
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for {}", urls_.front().description());
        return observer->finishEnumeratingWithError(errorFor(LocalTesselKitError::unableToGetDeviceUUID));
    }
    if (token->deviceUUID != *volume)
        logInfo("device UUID changed ({} -> {})", token->deviceUUID.string(), volume->string());
    observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
}

void LocalFileEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<TesselSyncAnchor>)> completion) {
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for \"{}\"", urls_.front().description());
        return completion(std::nullopt);
    }
    FSChangeToken token;
    token.deviceUUID = *volume;
    token.streamEventID = EventStream::currentEventID();
    completion(token.encode());
}

}  // namespace cindral
