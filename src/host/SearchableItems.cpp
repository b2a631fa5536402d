#include "host/SearchableItems.h"

#include <utility>

namespace cindral {

void SearchableItemsInMemory::put(const TesselItemIdentifier& identifier, const std::string& domain) {
    const MutexLock lock(mutex_);
    std::string& current = domains_[identifier];
    if (!current.empty()) items_[current].erase(identifier);
    current = domain;
    items_[domain].insert(identifier);
}

std::set<TesselItemIdentifier> SearchableItemsInMemory::itemsOf(const std::string& domain) const {
    const MutexLock lock(mutex_);
    const auto found = items_.find(domain);
    return found == items_.end() ? std::set<TesselItemIdentifier>() : found->second;
}

void SearchableItemsInMemory::deleteItems(const std::vector<std::string>& domains,
                                          TesselManager::Completion completion) {
    {
        const MutexLock lock(mutex_);
        for (const std::string& domain : domains) {
            const auto gone = items_.extract(domain);
            if (gone.empty()) continue;
            for (const TesselItemIdentifier& identifier : gone.mapped()) domains_.erase(identifier);
        }
    }
    if (completion) completion(std::nullopt);
}

}  // namespace cindral
