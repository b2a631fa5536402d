// Imports, folders, renames, moves and deletions.

#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselErrors.h"
#include "provider/LocalTesselKit.h"
#include "provider/LocalTesselKitError.h"

namespace cindral {

namespace {

bool isContainerIdentifier(const TesselItemIdentifier& identifier) {
    return identifier.starts_with('#') || identifier == kTesselRootContainerItemIdentifier ||
           identifier == kTesselWorkingSetContainerItemIdentifier ||
           identifier == kTesselAllDirectoriesContainerItemIdentifier ||
           identifier == kTesselTemporaryLocalFolderItemIdentifier;
}

}  // namespace

Result<std::shared_ptr<const TesselItem>> LocalTesselKit::itemAtURL(const KsURL& url) {
    const auto identifier = persistentIdentifierForItemAt(url);
    if (!identifier) {
        logError("identifier lookup failed for URL \"{}\"", url.description());
        return errorFor(LocalTesselKitError::invalidItemIdentifier).with("path", url.path());
    }
    if (isContainerIdentifier(*identifier)) return std::shared_ptr<const TesselItem>(TRY(fetchItem(*identifier)));
    std::shared_ptr<const TesselItem> item = LocalItem::initWithURL(url);
    if (!item) {
        logError("can't create item for URL \"{}\"", url.description());
        return errorFor(LocalTesselKitError::invalidItemIdentifier).with("path", url.path());
    }
    return item;
}

KsError LocalTesselKit::translated(const KsError& error) {
    const std::optional<KsURL> colliding = ts_collidingURL(error);
    if (!colliding) return error;
    const auto item = itemAtURL(*colliding);
    return item.ok() ? tesselErrorForCollisionWithItem(*item) : item.error();
}

Result<std::shared_ptr<const TesselItem>> LocalTesselKit::converted(const Result<KsURL>& result) {
    return result.ok() ? itemAtURL(*result) : Result<std::shared_ptr<const TesselItem>>(translated(result.error()));
}

std::shared_ptr<TesselProgress> LocalTesselKit::importDocumentAtURL(const KsURL& url,
                                                                    const TesselItemIdentifier& parent,
                                                                    ItemCompletion completion) {
    const LogSection section("import document at \"{}\" to parent \"{}\"", url.path(), parent);
    if (parent == kTesselRootContainerItemIdentifier) {
        completion(KsError::errorFileWriteNoPermission());
        return nullptr;
    }
    const Result<KsURL> folder = urlForItem(parent);
    if (!folder.ok()) {
        completion(folder.error());
        return nullptr;
    }
    return ts_importUnderFolder(url, *folder, [completion = std::move(completion)](const Result<KsURL>& result) {
        completion(converted(result));
    });
}

void LocalTesselKit::createDirectoryWithName(const std::string& name, const TesselItemIdentifier& parent,
                                             ItemCompletion completion) {
    const LogSection section("create directory with name \"{}\" in parent \"{}\"", name, parent);
    if (parent == kTesselRootContainerItemIdentifier) return completion(KsError::errorFileWriteNoPermission());
    const Result<KsURL> folder = urlForItem(parent);
    if (!folder.ok()) return completion(folder.error());
    ts_createSubFolder(*folder, name, [completion = std::move(completion)](const Result<KsURL>& result) {
        completion(converted(result));
    });
}

void LocalTesselKit::renameItemWithIdentifier(const TesselItemIdentifier& identifier, const std::string& name,
                                              ItemCompletion completion) {
    const LogSection section("rename item \"{}\" to name \"{}\"", identifier, name);
    const Result<KsURL> url = urlForItem(identifier);
    if (!url.ok()) return completion(url.error());
    ts_renameWithNewName(*url, name, [completion = std::move(completion)](const Result<KsURL>& result) {
        completion(converted(result));
    });
}

std::shared_ptr<TesselProgress> LocalTesselKit::reparentItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                           const TesselItemIdentifier& parent,
                                                                           const std::optional<std::string>& newName,
                                                                           ItemCompletion completion) {
    const LogSection section("move item \"{}\" to parent \"{}\"", identifier, parent);
    if (identifier == kTesselRootContainerItemIdentifier) {
        completion(KsError::errorFileWriteNoPermission());
        return nullptr;
    }
    const std::optional<KsURL> url = urlForItemWithPersistentIdentifier(identifier);
    if (!url) {
        completion(tsItemNotFoundError(identifier));
        return nullptr;
    }
    const std::optional<KsURL> folder = urlForItemWithPersistentIdentifier(parent);
    if (!folder) {
        completion(tsItemNotFoundError(parent));
        return nullptr;
    }
    return ts_reparentUnderFolder(
        *url, *folder, newName,
        [completion = std::move(completion)](const Result<KsURL>& result) { completion(converted(result)); });
}

std::shared_ptr<TesselProgress> LocalTesselKit::deleteItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                         Completion completion) {
    const LogSection section("delete item \"{}\"", identifier);
    const std::optional<KsURL> url = urlForItemWithPersistentIdentifier(identifier);
    if (!url) {
        completion(tsItemNotFoundError(identifier));
        return nullptr;
    }
    return ts_deleteWithCompletionHandler(*url, std::move(completion));
}

}  // namespace cindral
