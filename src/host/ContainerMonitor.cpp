#include "host/ContainerMonitor.h"

#include <utility>

namespace cindral {

ContainerMonitor::ContainerMonitor(ProviderAccess& client, SignalDispatcher& signals, Tell tell)
    : client_(client), signals_(signals), tell_(std::move(tell)) {
    subscription_ = signals_.subscribe([this](const TesselItemIdentifier& container) { didSignal(container); });
}

ContainerMonitor::~ContainerMonitor() {
    signals_.unsubscribe(subscription_);
    std::set<TesselItemIdentifier> monitored;
    {
        const MutexLock lock(mutex_);
        pending_.clear();
        monitored.swap(monitored_);
    }
    for (const auto& container : monitored) client_.stopMonitoring(container);
    queue_.sync([] {});
}

Result<void> ContainerMonitor::start(const TesselItemIdentifier& container) {
    {
        // Before it is watched, so that its first signal finds it.
        const MutexLock lock(mutex_);
        if (!monitored_.insert(container).second) return {};
    }
    auto started = client_.startMonitoring(container);
    if (!started.ok()) {
        const MutexLock lock(mutex_);
        monitored_.erase(container);
    }
    return started;
}

void ContainerMonitor::stop(const TesselItemIdentifier& container) {
    {
        const MutexLock lock(mutex_);
        if (monitored_.erase(container) == 0) return;
        pending_.erase(container);
    }
    client_.stopMonitoring(container);
    // Who is being told now has been told.
    queue_.sync([] {});
}

void ContainerMonitor::didSignal(const TesselItemIdentifier& container) {
    const MutexLock lock(mutex_);
    if (!monitored_.contains(container)) return;
    const bool isIdle = pending_.empty();
    if (pending_.insert(container).second && isIdle) queue_.async([this] { tellPending(); });
}

std::set<TesselItemIdentifier> ContainerMonitor::takePending() {
    const MutexLock lock(mutex_);
    return std::exchange(pending_, {});
}

void ContainerMonitor::tellPending() {
    for (const auto& container : takePending()) tell_(container);
}

}  // namespace cindral
