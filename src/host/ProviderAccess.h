#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// One page of a listing.
struct ItemsPage {
    TesselItems items;
    std::optional<TesselPage> nextPage;  ///< none: the listing is over
};

/// What one enumeration of changes said.
struct ChangesBatch {
    struct Entry {
        /// An update; null for a deletion.
        std::shared_ptr<const TesselItem> item;
        TesselItemIdentifier identifier;
    };
    std::vector<Entry> log;  ///< in the order in which the provider sent it
    TesselSyncAnchor anchor;
    bool moreComing = false;
};

/// What a command asks of a provider, wherever that is: in this process (ProviderClient), or in the daemon that runs for
/// the same state folder (RemoteClient).
///
/// Thread safety: all operations, from any thread. Each waits for its answer.
class ProviderAccess {
public:
    virtual ~ProviderAccess() = default;

    virtual TesselExtension& provider() const = 0;

    virtual Result<ItemsPage> itemsOnPage(const TesselItemIdentifier& container, const TesselPage& page) = 0;
    /// None in the result: the provider has no anchor to give.
    virtual Result<std::optional<TesselSyncAnchor>> anchor(const TesselItemIdentifier& container) = 0;
    virtual Result<ChangesBatch> changesSince(const TesselItemIdentifier& container,
                                              const TesselSyncAnchor& anchor) = 0;

    /// Until stopMonitoring(), the container is signalled when something in it changes. Twice is once.
    virtual Result<void> startMonitoring(const TesselItemIdentifier& container) = 0;
    virtual void stopMonitoring(const TesselItemIdentifier& container) = 0;
};

}  // namespace cindral
