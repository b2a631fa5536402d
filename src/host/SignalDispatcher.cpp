#include "host/SignalDispatcher.h"

#include "platform/foundation/ThreadPool.h"

namespace cindral {

std::uint64_t SignalDispatcher::subscribe(Receiver receiver) {
    auto shared = std::make_shared<const Receiver>(std::move(receiver));
    const MutexLock lock(mutex_);
    subscriptions_[++lastSubscription_].receiver = std::move(shared);
    return lastSubscription_;
}

void SignalDispatcher::unsubscribe(std::uint64_t subscription) {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    const auto found = subscriptions_.find(subscription);
    if (found == subscriptions_.end()) return;
    found->second.receiver.reset();
    while (found->second.calls > 0) callEnded_.wait(mutex_);
    subscriptions_.erase(found);
}

std::vector<std::pair<std::uint64_t, std::shared_ptr<const SignalDispatcher::Receiver>>>
SignalDispatcher::beginCalls() {
    std::vector<std::pair<std::uint64_t, std::shared_ptr<const Receiver>>> calls;
    const MutexLock lock(mutex_);
    for (auto& [number, subscription] : subscriptions_) {
        if (!subscription.receiver) continue;
        ++subscription.calls;
        calls.emplace_back(number, subscription.receiver);
    }
    return calls;
}

void SignalDispatcher::endCall(std::uint64_t subscription) {
    const MutexLock lock(mutex_);
    // It is there: nobody takes it away while a call is under way.
    if (--subscriptions_.at(subscription).calls == 0) callEnded_.notifyAll();
}

void SignalDispatcher::signalEnumerator(const TesselItemIdentifier& container, TesselManager::Completion completion) {
    for (const auto& [subscription, receiver] : beginCalls()) {
        (*receiver)(container);
        endCall(subscription);
    }
    if (completion) completion(std::nullopt);
}

void SignalDispatcher::setSearchableItems(std::shared_ptr<SearchableItems> items) {
    // What was there goes after the lock.
    const MutexLock lock(mutex_);
    searchableItems_.swap(items);
}

void SignalDispatcher::deleteSearchableItems(const std::vector<std::string>& domains,
                                             TesselManager::Completion completion) {
    std::shared_ptr<SearchableItems> items;
    {
        const MutexLock lock(mutex_);
        items = searchableItems_;
    }
    if (items) return items->deleteItems(domains, std::move(completion));
    if (completion) completion(std::nullopt);
}

}  // namespace cindral
