#include "host/QueryWatches.h"

#include <utility>

namespace cindral {

QueryWatches::QueryWatches(SearchQueries& queries, Tell tell) : queries_(queries), tell_(std::move(tell)) {}

QueryWatches::~QueryWatches() {
    std::map<std::uint64_t, std::uint64_t> watches;
    {
        const MutexLock lock(mutex_);
        watches.swap(watches_);
        pending_.clear();
    }
    for (const auto& [number, watch] : watches) queries_.unwatch(watch);
    queue_.sync([] {});
}

Result<std::uint64_t> QueryWatches::watch(const SearchQuery& query) {
    std::uint64_t number = 0;
    {
        const MutexLock lock(mutex_);
        number = ++last_;
    }
    const std::uint64_t watch = TRY(queries_.watch(query, [this, number] { didChange(number); }));
    const MutexLock lock(mutex_);
    watches_.emplace(number, watch);
    return number;
}

bool QueryWatches::unwatch(std::uint64_t number) {
    std::uint64_t watch = 0;
    {
        const MutexLock lock(mutex_);
        const auto found = watches_.find(number);
        if (found == watches_.end()) return false;
        watch = found->second;
        watches_.erase(found);
    }
    queries_.unwatch(watch);
    {
        const MutexLock lock(mutex_);
        pending_.erase(number);
    }
    // Who is being told now has been told.
    queue_.sync([] {});
    return true;
}

void QueryWatches::didChange(std::uint64_t watch) {
    const MutexLock lock(mutex_);
    const bool isIdle = pending_.empty();
    if (pending_.insert(watch).second && isIdle) queue_.async([this] { tellPending(); });
}

void QueryWatches::tellPending() {
    std::set<std::uint64_t> pending;
    {
        const MutexLock lock(mutex_);
        pending.swap(pending_);
    }
    for (const std::uint64_t watch : pending) tell_(watch);
}

}  // namespace cindral
