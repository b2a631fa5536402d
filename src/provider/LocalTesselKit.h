#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/TSPacer.h"
#include "platform/tessel/TesselExtension.h"
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

    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override;

    SerialQueue& appRefreshQueue() { return appRefreshQueue_; }
    TSPacer& appRefreshPacer() { return appRefreshPacer_; }

private:
    /// What the notification centre knows instead of the provider, so that it never holds it.
    class InstalledAppsProxy;

    LocalTesselKit();
    static void notificationCallback(const void* observer, std::string_view name);
    std::optional<KsURL> urlForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier);
    std::optional<TesselItemIdentifier> persistentIdentifierForItemAt(const KsURL& url);
    static std::shared_ptr<const LocalItem> resolveItem(const TesselItemIdentifier& identifier,
                                                        LocalItem::Customs customs = LocalItem::Customs());
    /// The URL of an item, or the host's no-such-item error.
    static Result<KsURL> urlForItem(const TesselItemIdentifier& identifier);

    SerialQueue appRefreshQueue_{"cindral.app-refresh.queue"};
    TSPacer appRefreshPacer_;
    std::shared_ptr<InstalledAppsProxy> installedAppsProxy_;
};

}  // namespace cindral
