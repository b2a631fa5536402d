#pragma once

#include <atomic>
#include <span>
#include <vector>

#include "host/ProviderClient.h"
#include "host/search/SearchStore.h"

namespace cindral {

/// Brings the search index to the present: gathers what there is, once, and then follows the changes of the working set.
///
/// A gather begins with an anchor. Then every folder is listed by itself, the containers that are still to be listed
/// being part of the index, and then the changes since the anchor are applied; a folder that these bring along is listed
/// too. So whatever is deleted or moved meanwhile sets back the listing of one folder at most, and nothing that is
/// already in the index; and a process that ends goes on where it was.
///
/// Thread safety: for one thread at a time; stop() from any.
class SearchFollower {
public:
    /// Borrowed for life.
    explicit SearchFollower(ProviderClient& client) : client_(client) {}

    /// Returns when everything that was complete before the call is in the store. `gathered` says whether the index was
    /// gathered anew on the way.
    Result<void> catchUp(SearchStore& store, bool& gathered);
    /// All there is will be gathered once more by the next catchUp().
    Result<void> beginGather(SearchStore& store);
    /// What is under way ends with ECANCELED, as all that is begun later.
    void stop() { isStopped_ = true; }

private:
    class Listing;
    Result<void> listAll(SearchStore& store);
    Result<bool> followOnce(SearchStore& store);
    Result<void> confirmForgotten(SearchStore& store);
    Result<void> checkStopped() const;

    ProviderClient& client_;
    std::atomic<bool> isStopped_ = false;
};

}  // namespace cindral
