// Imports, folders, renames, moves and deletions.

#include <cerrno>
#include <utility>

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

void LocalTesselKit::attempt(std::function<void(const Again&)> edit) {
    const auto shared = std::make_shared<const std::function<void(const Again&)>>(std::move(edit));
    (*shared)([shared] {
        (*shared)([] { return false; });
        return true;
    });
}

bool LocalTesselKit::hasGone(const KsError& error, const MeantFile& file) {
    if (!error.isPosix(ESTALE) && !error.is(kKsGeneralErrorDomain, kKsFileNoSuchFileError)) return false;
    const auto subject = error.userInfo().find("path");
    if (subject == error.userInfo().end()) return true;
    const std::string& path = file.url.path();
    return path == subject->second || path.starts_with(subject->second + "/");
}

std::shared_ptr<TesselProgress> LocalTesselKit::importDocumentAtURL(const KsURL& url,
                                                                    const TesselItemIdentifier& parent,
                                                                    ItemCompletion completion) {
    const LogSection section("import document at \"{}\" to parent \"{}\"", url.path(), parent);
    if (parent == kTesselRootContainerItemIdentifier) {
        completion(KsError::errorFileWriteNoPermission());
        return nullptr;
    }
    auto progress = std::make_shared<TesselProgress>();
    attempt([url, parent, progress, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> folder = find(parent, Lookup::strict);
        if (!folder.ok()) return completion(folder.error());
        ts_importUnderFolder(
            url, *folder,
            [parent, folder = *folder, again, completion](const Result<KsURL>& imported) {
                if (imported.ok() || !hasGone(imported.error(), folder)) return completion(converted(imported));
                if (!again()) completion(missingItem(parent, Lookup::strict));
            },
            progress);
    });
    return progress;
}

void LocalTesselKit::createDirectoryWithName(const std::string& name, const TesselItemIdentifier& parent,
                                             ItemCompletion completion) {
    const LogSection section("create directory with name \"{}\" in parent \"{}\"", name, parent);
    if (parent == kTesselRootContainerItemIdentifier) return completion(KsError::errorFileWriteNoPermission());
    attempt([name, parent, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> folder = find(parent, Lookup::strict);
        if (!folder.ok()) return completion(folder.error());
        ts_createSubFolder(*folder, name, [parent, folder = *folder, again, completion](const Result<KsURL>& created) {
            if (created.ok() || !hasGone(created.error(), folder)) return completion(converted(created));
            if (!again()) completion(missingItem(parent, Lookup::strict));
        });
    });
}

void LocalTesselKit::renameItemWithIdentifier(const TesselItemIdentifier& identifier, const std::string& name,
                                              ItemCompletion completion) {
    const LogSection section("rename item \"{}\" to name \"{}\"", identifier, name);
    attempt([identifier, name, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> file = find(identifier, Lookup::strict);
        if (!file.ok()) return completion(file.error());
        ts_renameWithNewName(*file, name, [identifier, file = *file, again, completion](const Result<KsURL>& renamed) {
            if (renamed.ok() || !hasGone(renamed.error(), file)) return completion(converted(renamed));
            if (!again()) completion(missingItem(identifier, Lookup::strict));
        });
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
    auto progress = std::make_shared<TesselProgress>();
    attempt([identifier, parent, newName, progress, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> file = find(identifier, Lookup::lenient);
        if (!file.ok()) return completion(file.error());
        const Result<MeantFile> folder = find(parent, Lookup::lenient);
        if (!folder.ok()) return completion(folder.error());
        ts_reparentUnderFolder(
            *file, *folder, newName,
            [identifier, parent, file = *file, folder = *folder, again, completion](const Result<KsURL>& moved) {
                const bool isItemGone = !moved.ok() && hasGone(moved.error(), file);
                const bool isParentGone = !moved.ok() && hasGone(moved.error(), folder);
                if (!isItemGone && !isParentGone) return completion(converted(moved));
                if (!again()) completion(missingItem(isItemGone ? identifier : parent, Lookup::lenient));
            },
            progress);
    });
    return progress;
}

std::shared_ptr<TesselProgress> LocalTesselKit::deleteItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                         Completion completion) {
    const LogSection section("delete item \"{}\"", identifier);
    auto progress = std::make_shared<TesselProgress>();
    attempt([identifier, progress, completion = std::move(completion)](const Again& again) {
        const Result<MeantFile> file = find(identifier, Lookup::lenient);
        if (!file.ok()) return completion(file.error());
        ts_deleteWithCompletionHandler(
            *file,
            [identifier, file = *file, again, completion](const std::optional<KsError>& error) {
                if (!error || !hasGone(*error, file)) return completion(error);
                if (!again()) completion(missingItem(identifier, Lookup::lenient));
            },
            progress);
    });
    return progress;
}

}  // namespace cindral
