#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "host/SearchableItems.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {

/// What the provider may ask of this host: passes signals of containers on to whoever subscribed.
///
/// A signal's completion is called at once: nobody's slowness holds up the provider. What is to be forgotten is passed on
/// to what is searchable; where nothing is, it is done at once.
///
/// Thread safety: all operations, from any thread.
class SignalDispatcher final : public TesselManager::Host {
public:
    /// Called on the provider's threads, by several at a time; only passes on.
    using Receiver = std::function<void(const TesselItemIdentifier& container)>;
    std::uint64_t subscribe(Receiver receiver);
    /// Returns when no call to the receiver is under way any more. Not to be called by the receiver.
    void unsubscribe(std::uint64_t subscription);

    void setSearchableItems(std::shared_ptr<SearchableItems> items);

    void signalEnumerator(const TesselItemIdentifier& container, TesselManager::Completion completion) override;
    void deleteSearchableItems(const std::vector<std::string>& domains, TesselManager::Completion completion) override;

private:
    struct Subscription {
        std::shared_ptr<const Receiver> receiver;
        int calls = 0;  ///< under way
    };
    std::vector<std::pair<std::uint64_t, std::shared_ptr<const Receiver>>> beginCalls();
    void endCall(std::uint64_t subscription);

    Mutex mutex_;
    Condition callEnded_;
    std::map<std::uint64_t, Subscription> subscriptions_ GUARDED_BY(mutex_);
    std::uint64_t lastSubscription_ GUARDED_BY(mutex_) = 0;
    std::shared_ptr<SearchableItems> searchableItems_ GUARDED_BY(mutex_);
};

}  // namespace cindral
