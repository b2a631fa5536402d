#include "provider/fs/FSListingPositions.h"

namespace cindral {

namespace {

// A hint is a few hundred bytes: enough for every listing under way, and for going back over the last pages of a few.
constexpr std::size_t kPositionsMax = 256;

}  // namespace

FSListingPositions& FSListingPositions::shared() {
    // Never destroyed: a listing may outlast the end of main.
    static FSListingPositions& positions = *new FSListingPositions(kPositionsMax);
    return positions;
}

std::string FSListingPositions::fullKey(const std::string& key, std::uint64_t offset) {
    return std::to_string(offset) + "@" + key;
}

void FSListingPositions::put(const std::string& key, std::uint64_t offset, ListingPosition position) {
    std::string full = fullKey(key, offset);
    auto shared = std::make_shared<const ListingPosition>(std::move(position));
    const MutexLock lock(mutex_);
    if (const auto found = byKey_.find(full); found != byKey_.end()) {
        newestFirst_.erase(found->second);
        byKey_.erase(found);
    }
    newestFirst_.push_front({full, std::move(shared)});
    byKey_.emplace(std::move(full), newestFirst_.begin());
    if (newestFirst_.size() > capacity_) {
        byKey_.erase(newestFirst_.back().key);
        newestFirst_.pop_back();
    }
}

std::shared_ptr<const ListingPosition> FSListingPositions::find(const std::string& key, std::uint64_t offset) {
    const MutexLock lock(mutex_);
    const auto found = byKey_.find(fullKey(key, offset));
    if (found == byKey_.end()) return nullptr;
    newestFirst_.splice(newestFirst_.begin(), newestFirst_, found->second);
    return found->second->position;
}

void FSListingPositions::removeAll() {
    const MutexLock lock(mutex_);
    newestFirst_.clear();
    byKey_.clear();
}

}  // namespace cindral
