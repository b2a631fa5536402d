#pragma once

#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

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

}  // namespace cindral
