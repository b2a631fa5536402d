#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <vector>

#include "platform/foundation/KsError.h"
#include "platform/tessel/TesselItem.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

using TesselItems = std::vector<std::shared_ptr<const TesselItem>>;

/// Receives one page of a listing. Exactly one of the two finishing calls ends it; nothing follows.
class TesselEnumerationObserver {
public:
    virtual ~TesselEnumerationObserver() = default;
    virtual void didEnumerateItems(TesselItems items) = 0;
    /// No next page: the listing is over.
    virtual void finishEnumeratingUpToPage(std::optional<TesselPage> nextPage) = 0;
    virtual void finishEnumeratingWithError(const KsError& error) = 0;
};

/// Receives the changes since an anchor. Exactly one of the two finishing calls ends it; nothing follows.
class TesselChangeObserver {
public:
    virtual ~TesselChangeObserver() = default;
    virtual void didUpdateItems(TesselItems items) = 0;
    virtual void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) = 0;
    virtual void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) = 0;
    virtual void finishEnumeratingWithError(const KsError& error) = 0;
};

/// Lists one container, and follows its changes.
///
/// Thread safety: all operations, from any thread. An observer is kept until it has been finished, and may be called
/// on any thread, by one at a time.
class TesselEnumerator {
public:
    virtual ~TesselEnumerator() = default;
    /// Where the container was when the enumerator was made, which is where it looks. None where it looks in several
    /// places.
    virtual std::optional<KsURL> enumeratedItemURL() const { return std::nullopt; }
    virtual void enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                           const TesselPage& page) = 0;
    virtual void enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                             const TesselSyncAnchor& anchor) = 0;
    virtual void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<TesselSyncAnchor>)> completion) = 0;
    /// From start() to stop(), the container is signalled through the manager when something in it changes. stop() also
    /// ends the change enumerations that are under way, with an error.
    virtual void start() = 0;
    virtual void stop() = 0;
    /// stop(), for the last time.
    virtual void invalidate() = 0;
};

}  // namespace cindral
