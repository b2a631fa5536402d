#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselEnumerator.h"
#include "platform/tessel/TesselItem.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// What a provider is to its host: lookups, enumerators, and calls around a document's contents.
///
/// The host makes one through the provider's factory (TesselExtensionFactory), and calls it on its own threads.
///
/// Thread safety: all operations, from any thread, at the same time.
class TesselExtension {
public:
    using Completion = std::function<void(std::optional<KsError>)>;
    using ItemCompletion = std::function<void(Result<std::shared_ptr<const TesselItem>>)>;

    virtual ~TesselExtension() = default;

    /// Returns when the provider knows which folders it publishes. The host waits for that before its first request.
    virtual void waitUntilReady() {}

    virtual std::optional<KsURL> URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) = 0;
    virtual std::optional<TesselItemIdentifier> persistentIdentifierForItemAtURL(const KsURL& url) = 0;
    virtual Result<std::shared_ptr<const TesselItem>> itemForIdentifier(const TesselItemIdentifier& identifier) = 0;
    virtual Result<std::shared_ptr<TesselEnumerator>> enumeratorForContainerItemIdentifier(
        const TesselItemIdentifier& container) = 0;

    virtual void providePlaceholderAtURL(const KsURL& url, Completion completion) = 0;
    virtual void startProvidingItemAtURL(const KsURL& url, Completion completion) = 0;
    virtual void stopProvidingItemAtURL(const KsURL& url) = 0;
    virtual void itemChangedAtURL(const KsURL& url) = 0;

    // Edits. Each answers once, on any thread, also after the call has returned, with the item that there is afterwards
    // or an error. Where progress comes back, it can be followed and cancelled. A name that is taken is answered with
    // tesselErrorForCollisionWithItem(). A provider that does not offer one answers ENOTSUP: the default of each.

    /// Copies a document or folder from anywhere into a container.
    virtual std::shared_ptr<TesselProgress> importDocumentAtURL(const KsURL& url, const TesselItemIdentifier& parent,
                                                                ItemCompletion completion);
    virtual void createDirectoryWithName(const std::string& name, const TesselItemIdentifier& parent,
                                         ItemCompletion completion);
    virtual void renameItemWithIdentifier(const TesselItemIdentifier& identifier, const std::string& name,
                                          ItemCompletion completion);
    /// Moves; without a new name the item keeps its own.
    virtual std::shared_ptr<TesselProgress> reparentItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                       const TesselItemIdentifier& parent,
                                                                       const std::optional<std::string>& newName,
                                                                       ItemCompletion completion);
    virtual std::shared_ptr<TesselProgress> deleteItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                     Completion completion);
    virtual void trashItemWithIdentifier(const TesselItemIdentifier& identifier, ItemCompletion completion);
    /// Takes an item out of the trash: to the parent, where one is named and will do, else to where it was.
    virtual std::shared_ptr<TesselProgress> untrashItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                      const std::optional<TesselItemIdentifier>& parent,
                                                                      ItemCompletion completion);
    /// Deletes what was trashed before the date. Answers when all deletions are done, with the first error.
    virtual void removeTrashedItemsOlderThanDate(const KsDate& date, Completion completion);

    // The user's metadata of an item. None takes it away.
    virtual void setLastUsedDate(const std::optional<KsDate>& date, const TesselItemIdentifier& identifier,
                                 ItemCompletion completion);
    /// `tagData` is what tsTagsData() makes.
    virtual void setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                            ItemCompletion completion);
    virtual void setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                                 ItemCompletion completion);

    /// The default save location of an application.
    virtual void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                                ItemCompletion completion) = 0;

    /// A thumbnail, or none; the second also with its type.
    using ThumbnailCompletion = std::function<void(const TesselItemIdentifier&, std::optional<Bytes>)>;
    using TypedThumbnailCompletion =
        std::function<void(const TesselItemIdentifier&, std::optional<Bytes>, std::optional<std::string>)>;
    /// Calls back once for each identifier, in their order, then the completion, always without an error: a provider
    /// that draws no thumbnail leaves it to the host. The size is in pixels, and a wish.
    virtual void fetchThumbnailsForItemIdentifiers(const std::vector<TesselItemIdentifier>& identifiers,
                                                   unsigned requestedSize, ThumbnailCompletion perThumbnail,
                                                   Completion completion) {
        fetchThumbnailsForItemIdentifiersWithType(
            identifiers, requestedSize,
            [perThumbnail = std::move(perThumbnail)](const TesselItemIdentifier& identifier, std::optional<Bytes> data,
                                                     const std::optional<std::string>& /*type*/) {
                perThumbnail(identifier, std::move(data));
            },
            std::move(completion));
    }
    virtual void fetchThumbnailsForItemIdentifiersWithType(const std::vector<TesselItemIdentifier>& identifiers,
                                                           unsigned /*requestedSize*/,
                                                           TypedThumbnailCompletion perThumbnail,
                                                           Completion completion) {
        for (const TesselItemIdentifier& identifier : identifiers) perThumbnail(identifier, std::nullopt, std::nullopt);
        completion(std::nullopt);
    }
};

/// Makes a provider. Each provider library exports one function of this type.
using TesselExtensionFactory = std::shared_ptr<TesselExtension> (*)();

}  // namespace cindral
