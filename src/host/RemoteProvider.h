#pragma once

#include "host/DaemonConnection.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// The daemon's provider, as a command in another process uses it: what it is asked is asked of the daemon.
///
/// Paths are those that clients know. Containers are enumerated by RemoteClient; what only a host's own provider can do
/// is answered with ENOTSUP.
///
/// Thread safety: all operations, from any thread.
class RemoteProvider final : public TesselExtension {
public:
    /// Borrowed for life.
    explicit RemoteProvider(DaemonConnection& connection) : connection_(connection) {}

    std::optional<KsURL> URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) override;
    std::optional<TesselItemIdentifier> persistentIdentifierForItemAtURL(const KsURL& url) override;
    Result<std::shared_ptr<const TesselItem>> itemForIdentifier(const TesselItemIdentifier& identifier) override;
    Result<std::shared_ptr<TesselEnumerator>> enumeratorForContainerItemIdentifier(
        const TesselItemIdentifier& container) override;

    void providePlaceholderAtURL(const KsURL& url, Completion completion) override;
    void startProvidingItemAtURL(const KsURL& url, Completion completion) override;
    void stopProvidingItemAtURL(const KsURL& url) override;
    void itemChangedAtURL(const KsURL& url) override;

    std::shared_ptr<TesselProgress> importDocumentAtURL(const KsURL& url, const TesselItemIdentifier& parent,
                                                        ItemCompletion completion) override;
    void createDirectoryWithName(const std::string& name, const TesselItemIdentifier& parent,
                                 ItemCompletion completion) override;
    void renameItemWithIdentifier(const TesselItemIdentifier& identifier, const std::string& name,
                                  ItemCompletion completion) override;
    std::shared_ptr<TesselProgress> reparentItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                               const TesselItemIdentifier& parent,
                                                               const std::optional<std::string>& newName,
                                                               ItemCompletion completion) override;
    std::shared_ptr<TesselProgress> deleteItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                             Completion completion) override;
    void trashItemWithIdentifier(const TesselItemIdentifier& identifier, ItemCompletion completion) override;
    std::shared_ptr<TesselProgress> untrashItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                              const std::optional<TesselItemIdentifier>& parent,
                                                              ItemCompletion completion) override;
    void removeTrashedItemsOlderThanDate(const KsDate& date, Completion completion) override;

    void setLastUsedDate(const std::optional<KsDate>& date, const TesselItemIdentifier& identifier,
                         ItemCompletion completion) override;
    void setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                    ItemCompletion completion) override;
    void setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                         ItemCompletion completion) override;
    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override;
    void fetchThumbnailsForItemIdentifiers(const std::vector<TesselItemIdentifier>& identifiers, unsigned requestedSize,
                                           ThumbnailCompletion perThumbnail, Completion completion) override;

private:
    using Params = DaemonConnection::Params;
    /// Sends a request that is answered with an item, or with {}.
    void sendForItem(std::string_view method, const Params& params, ItemCompletion completion,
                     std::shared_ptr<TesselProgress> progress = nullptr);
    void sendForEnd(std::string_view method, const Params& params, Completion completion,
                    std::shared_ptr<TesselProgress> progress = nullptr);

    DaemonConnection& connection_;
};

}  // namespace cindral
