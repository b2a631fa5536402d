#pragma once

#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {

/// What can be found by searching, as far as the provider has a say in it: the items of an application that is gone are
/// to be forgotten. A domain is an application's bundle identifier.
///
/// Thread safety: all operations, from any thread.
class SearchableItems {
public:
    virtual ~SearchableItems() = default;
    /// Forgets all items of the domains, then calls the completion, once; it may wait for neither the provider nor its
    /// queues.
    virtual void deleteItems(const std::vector<std::string>& domains, TesselManager::Completion completion) = 0;
};

/// The items by domain, in memory, for as long as the process lives.
class SearchableItemsInMemory final : public SearchableItems {
public:
    /// An item is of one domain: the last that was said.
    void put(const TesselItemIdentifier& identifier, const std::string& domain);
    std::set<TesselItemIdentifier> itemsOf(const std::string& domain) const;
    void deleteItems(const std::vector<std::string>& domains, TesselManager::Completion completion) override;

private:
    mutable Mutex mutex_;
    std::map<TesselItemIdentifier, std::string> domains_ GUARDED_BY(mutex_);
    std::map<std::string, std::set<TesselItemIdentifier>> items_ GUARDED_BY(mutex_);
};

}  // namespace cindral
