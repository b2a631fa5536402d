#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <set>

#include "host/SearchQueries.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// The queries that one client watches: tells the client when the answer of one may be another.
///
/// What changes while the client is told is told afterwards, each watch once. Ends with the object.
///
/// Thread safety: all operations, from any thread.
class QueryWatches {
public:
    /// Called by one at a time, on a queue; may take its time.
    using Tell = std::function<void(std::uint64_t watch)>;

    /// `queries` is borrowed for life.
    QueryWatches(SearchQueries& queries, Tell tell);
    ~QueryWatches();
    QueryWatches(const QueryWatches&) = delete;
    QueryWatches& operator=(const QueryWatches&) = delete;

    /// Answers the watch's number, which is the client's alone, and counts from 1.
    Result<std::uint64_t> watch(const SearchQuery& query);
    /// The client is told nothing more of the watch when this has returned. False for a number that is none.
    bool unwatch(std::uint64_t watch);

private:
    void didChange(std::uint64_t watch);
    void tellPending();

    SearchQueries& queries_;
    const Tell tell_;

    Mutex mutex_;
    std::map<std::uint64_t, std::uint64_t> watches_ GUARDED_BY(mutex_);  ///< the client's numbers, and the queries'
    std::set<std::uint64_t> pending_ GUARDED_BY(mutex_);                 ///< changed, and not yet told
    std::uint64_t last_ GUARDED_BY(mutex_) = 0;

    SerialQueue queue_{"cindral.query-watches"};
};

}  // namespace cindral
