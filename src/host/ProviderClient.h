#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>

#include "host/ProviderAccess.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// One client's way to a provider: a connection's, or a command's.
///
/// A container is looked up anew at each request, so that a folder that was renamed meanwhile goes on. The containers
/// that stand for many folders (root, working set, all directories) keep their enumerator for as long as the client
/// lives. So does a folder that is monitored: each request for its changes or its first page looks it up anew, and
/// monitors what it found.
///
/// Thread safety: all operations, from any thread. Completions run on any thread, once.
class ProviderClient final : public ProviderAccess {
public:
    explicit ProviderClient(std::shared_ptr<TesselExtension> provider) : provider_(std::move(provider)) {}
    /// Invalidates the kept enumerators, and waits for those that are being let go of. No request may be under way.
    ~ProviderClient() override;
    ProviderClient(const ProviderClient&) = delete;
    ProviderClient& operator=(const ProviderClient&) = delete;

    TesselExtension& provider() const override { return *provider_; }

    using PageCompletion = std::function<void(Result<ItemsPage>)>;
    /// Asks the provider again while the container changes its place, as enumerateChanges() does, too, where the
    /// enumeration is cut short; ECANCELED where that does not end.
    void enumerateItems(const TesselItemIdentifier& container, const TesselPage& page, PageCompletion completion);
    /// None in the result: the provider has no anchor to give.
    using AnchorCompletion = std::function<void(Result<std::optional<TesselSyncAnchor>>)>;
    void currentSyncAnchor(const TesselItemIdentifier& container, AnchorCompletion completion);

    using ChangesCompletion = std::function<void(Result<ChangesBatch>)>;
    void enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                          ChangesCompletion completion);

    /// Until stopMonitoring(), an enumerator of the container is kept that has it signalled. Twice is once.
    Result<void> startMonitoring(const TesselItemIdentifier& container) override;
    void stopMonitoring(const TesselItemIdentifier& container) override;

    // The same for a caller that has nothing else to do.
    Result<ItemsPage> itemsOnPage(const TesselItemIdentifier& container, const TesselPage& page) override;
    Result<std::optional<TesselSyncAnchor>> anchor(const TesselItemIdentifier& container) override;
    Result<ChangesBatch> changesSince(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor) override;

private:
    class Handle;
    class Use;
    Result<std::shared_ptr<Handle>> enumerator(const TesselItemIdentifier& container);
    Result<std::shared_ptr<Handle>> keptEnumerator(const TesselItemIdentifier& container);
    Result<std::shared_ptr<Handle>> anyEnumerator(const TesselItemIdentifier& container);
    Result<std::shared_ptr<Handle>> comingEnumerator(const TesselItemIdentifier& container);
    void enumerateItems(const TesselItemIdentifier& container, const TesselPage& page, int attempts,
                        PageCompletion completion);
    void enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor, int attempts,
                          ChangesCompletion completion);

    const std::shared_ptr<TesselExtension> provider_;
    DispatchGroup invalidations_;  ///< and calls of enumerators that have not returned

    Mutex mutex_;
    std::map<TesselItemIdentifier, std::shared_ptr<Handle>> kept_ GUARDED_BY(mutex_);
    std::map<TesselItemIdentifier, std::shared_ptr<Handle>> monitored_ GUARDED_BY(mutex_);  ///< folders
};

}  // namespace cindral
