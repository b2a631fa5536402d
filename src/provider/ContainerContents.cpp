#include "provider/ContainerContents.h"

#include <algorithm>
#include <utility>

#include "platform/foundation/InternedString.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/TrashName.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/roster/Roster.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalItem.h"
#include "provider/fs/FSEntryFinder.h"

namespace cindral::container_contents {

namespace {

/// What the items of one folder have in common.
struct FolderContext {
    const DirectoryReference* folder = nullptr;
    std::optional<TesselItemIdentifier> identifier;
    InternedString bundleIdentifier;
};

/// The contexts of some entries' folders, each worked out once.
class FolderContexts {
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

bool isOfAnotherDevice(const KsURL& entry, const FileStatus& status) {
    if (status.device == entry.directory()->status.device) return false;
    if (RootDirectories::shared().noteLeftOut(entry.path(), "it is on another device than the storage")) {
        logInfo("leaving out {}; it is on another device than the storage", entry.description());
    }
    return true;
}

}  // namespace

bool isDeep(const TesselItemIdentifier& container) {
    return container == kTesselWorkingSetContainerItemIdentifier || isOfFoldersOnly(container);
}

bool isOfFoldersOnly(const TesselItemIdentifier& container) {
    return container == kTesselAllDirectoriesContainerItemIdentifier;
}

bool covers(const TesselItemIdentifier& container, const std::vector<KsURL>& urls, std::string_view path) {
    const KsURL* top = directoryHolding(urls, path);
    if (top == nullptr || isDeep(container)) return top != nullptr;
    return isAtOrBelow(top->path(), path.substr(0, std::max<std::size_t>(path.rfind('/'), 1)));
}

EnumeratorOptions scanOptions(const TesselItemIdentifier& container, const std::vector<KsURL>& urls) {
    EnumeratorOptions options;
    options.urls = urls;
    options.recursively = isDeep(container);
    options.directoryEnumerationOptionsFor = [](const KsURL&) {
        return DirectoryEnumerationOptions::skipsPackageDescendants;
    };
    return options;
}

bool isTrashName(std::string_view name) {
    return name == kTrashName;
}

bool isListed(const TesselItemIdentifier& container, const KsURL& entry) {
    if (isTrashName(entry.lastPathComponent())) return false;
    const Result<FileStatus> status = entry.status();
    if (!status.ok() || isOfAnotherDevice(entry, *status)) return false;
    return !isOfFoldersOnly(container) || entry.ts_isFolder();
}

Result<TesselItems> itemsOf(std::vector<KsURL> entries) {
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

}  // namespace cindral::container_contents
