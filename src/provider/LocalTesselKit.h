#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TSPacer.h"
#include "platform/tessel/TesselExtension.h"
#include "platform/tessel/TesselTags.h"
#include "provider/LocalItem.h"

namespace cindral {

/// The provider: publishes the document storage and the app libraries.
///
/// Keeps no cache: every identifier is resolved afresh.
///
/// Thread safety: all operations, from any thread, at the same time.
class LocalTesselKit : public TesselExtension {
public:
    /// A provider that listens for changes of the application registry, and has signalled the working set once. A
    /// missing notification centre stops the process.
    static std::shared_ptr<LocalTesselKit> init();
    ~LocalTesselKit() override;

    /// Until the registry of applications has been looked at for the first time.
    void waitUntilReady() override;

    std::optional<KsURL> URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) override;
    std::optional<TesselItemIdentifier> persistentIdentifierForItemAtURL(const KsURL& url) override;
    Result<std::shared_ptr<const TesselItem>> itemForIdentifier(const TesselItemIdentifier& identifier) override;
    Result<std::shared_ptr<TesselEnumerator>> enumeratorForContainerItemIdentifier(
        const TesselItemIdentifier& container) override;

    /// Documents are ordinary files, always there: nothing is written, and the completion is called at once.
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

    /// The trash is the folder ".Trash" in the first folder "Documents" of the item's path. A trashed item bears the
    /// date, and where it was.
    void trashItemWithIdentifier(const TesselItemIdentifier& identifier, ItemCompletion completion) override;
    std::shared_ptr<TesselProgress> untrashItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                              const std::optional<TesselItemIdentifier>& parent,
                                                              ItemCompletion completion) override;
    /// Of the storage and of every app library. What has no date yet is given one and kept; links, FIFOs and the like,
    /// which can't bear one, go by when they last changed, which being trashed is.
    void removeTrashedItemsOlderThanDate(const KsDate& date, Completion completion) override;

    /// An app library's is never written: its item comes back as it is.
    void setLastUsedDate(const std::optional<KsDate>& date, const TesselItemIdentifier& identifier,
                         ItemCompletion completion) override;
    void setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                    ItemCompletion completion) override;
    void setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                         ItemCompletion completion) override;

    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override;

    /// App libraries have their application's icon, everything else has none. On the caller's thread.
    void fetchThumbnailsForItemIdentifiersWithType(const std::vector<TesselItemIdentifier>& identifiers,
                                                   unsigned requestedSize, TypedThumbnailCompletion perThumbnail,
                                                   Completion completion) override;

    SerialQueue& appRefreshQueue() { return appRefreshQueue_; }
    TSPacer& appRefreshPacer() { return appRefreshPacer_; }

private:
    /// What the notification centre knows instead of the provider, so that it never holds it.
    class InstalledAppsProxy;
    /// Whether the first refresh is over. Shared with the refresh, which may outlast the provider.
    class FirstRefresh;

    LocalTesselKit();
    static void notificationCallback(const void* observer, std::string_view name);
    static std::optional<KsURL> urlForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier);
    static Result<MeantFile> lookUp(const TesselItemIdentifier& identifier);
    static std::optional<TesselItemIdentifier> persistentIdentifierForItemAt(const KsURL& url);
    static std::shared_ptr<const LocalItem> resolveItem(const TesselItemIdentifier& identifier,
                                                        LocalItem::Customs customs = LocalItem::Customs());
    /// The URL of an item, or the host's no-such-item error.
    static Result<KsURL> urlForItem(const TesselItemIdentifier& identifier);

    // What edits share. Static: what answers them may outlast the provider.

    /// How an item is looked for: what is not there is the host's no-such-item error; or it is logged, and is the host's
    /// item-not-found error.
    enum class Lookup { strict, lenient };
    /// Where an item is, and which object it is there.
    static Result<MeantFile> find(const TesselItemIdentifier& identifier, Lookup lookup);
    static KsError missingItem(const TesselItemIdentifier& identifier, Lookup lookup);
    /// Begins an edit once more, from the look for its item. False, and nothing is done, the second time.
    using Again = std::function<bool()>;
    /// Calls `edit`, and again where it asks for that.
    static void attempt(std::function<void(const Again&)> edit);
    /// Whether an edit failed because what it is about, or what holds that, was not where it was found any more.
    static bool hasGone(const KsError& error, const MeantFile& file);
    static Result<std::shared_ptr<const LocalItem>> fetchItem(const TesselItemIdentifier& identifier);
    /// What there is at a URL after an edit.
    static Result<std::shared_ptr<const TesselItem>> itemAtURL(const KsURL& url);
    /// An edit's error as the host knows it: of a name that is taken, with the item that has it.
    static KsError translated(const KsError& error);
    static Result<std::shared_ptr<const TesselItem>> converted(const Result<KsURL>& result);
    static Result<std::shared_ptr<const TesselItem>> withoutTrashDate(const KsURL& restored);
    static std::optional<KsURL> destinationOfUntrash(const LocalItem& item,
                                                     const std::optional<TesselItemIdentifier>& parent);
    struct Attribute {
        std::string_view name;
        std::optional<Bytes> value;
    };
    static Result<std::shared_ptr<const TesselItem>> withAttributes(const TesselItemIdentifier& identifier,
                                                                    Lookup lookup,
                                                                    const std::vector<Attribute>& attributes);
    static std::vector<Attribute> attributesFor(const std::vector<TSTag>& tags);
    static Result<void> setAttributes(const MeantFile& file, const std::vector<Attribute>& attributes,
                                      std::string_view& failing);
    static KsError notTagged(const TesselItemIdentifier& identifier);

    const std::shared_ptr<FirstRefresh> firstRefresh_;
    SerialQueue appRefreshQueue_{"cindral.app-refresh.queue"};
    TSPacer appRefreshPacer_;
    std::shared_ptr<InstalledAppsProxy> installedAppsProxy_;
};

}  // namespace cindral
