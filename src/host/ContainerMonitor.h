#pragma once

#include <functional>
#include <set>

#include "host/ProviderAccess.h"
#include "host/SignalDispatcher.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// The containers that one client monitors: keeps them watched, and tells the client when one is signalled.
///
/// Signals that come while the client is told of an earlier one are told together, each container once. Ends with the
/// object.
///
/// Thread safety: all operations, from any thread.
class ContainerMonitor {
public:
    /// Called by one at a time, on a queue; may take its time.
    using Tell = std::function<void(const TesselItemIdentifier& container)>;

    /// `client` and `signals` are borrowed for life.
    ContainerMonitor(ProviderAccess& client, SignalDispatcher& signals, Tell tell);
    ~ContainerMonitor();
    ContainerMonitor(const ContainerMonitor&) = delete;
    ContainerMonitor& operator=(const ContainerMonitor&) = delete;

    /// Twice is once. The provider's error when there is no such container.
    Result<void> start(const TesselItemIdentifier& container);
    /// The client is told nothing more of the container when this has returned.
    void stop(const TesselItemIdentifier& container);

private:
    void didSignal(const TesselItemIdentifier& container);
    void tellPending();
    std::set<TesselItemIdentifier> takePending();

    ProviderAccess& client_;
    SignalDispatcher& signals_;
    const Tell tell_;

    Mutex mutex_;
    std::set<TesselItemIdentifier> monitored_ GUARDED_BY(mutex_);
    std::set<TesselItemIdentifier> pending_ GUARDED_BY(mutex_);  ///< signalled, and not yet told

    SerialQueue queue_{"cindral.signals"};
    std::uint64_t subscription_ = 0;  // Constant once made.
};

}  // namespace cindral
