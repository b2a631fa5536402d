#include "provider/fs/FSGatherWitness.h"

#include <algorithm>

#include "platform/eventstream/EventStream.h"

namespace cindral {

namespace {

// Each is a few hundred bytes, and its watches: a client that walks a tree lists thousands of folders between two pages.
constexpr std::size_t kListingsMax = 4'096;
// For all listings; the user's limit is for all programs.
constexpr std::size_t kWatchesMax = 32'768;
// Twice the longest clock tick of the kernels that stamp files by the tick.
constexpr std::int64_t kCoarseStampNanoseconds = 20'000'000;

bool isSame(const Result<FileStatus>& now, const FileStatus& seen) {
    return now.ok() && now->fileID == seen.fileID && now->device == seen.device &&
           now->modificationTime == seen.modificationTime && now->changeTime == seen.changeTime;
}

/// Whether a change right after the folder was seen would show in its times.
bool isProvable(const DirectoryReference& folder) {
    if (folder.traits.stampsAreDistinct) return true;
    const KsDate& changed = folder.status.changeTime;
    const KsDate& seen = folder.seenAt;
    const std::int64_t age = (seen.seconds - changed.seconds) * 1'000'000'000 + seen.nanoseconds - changed.nanoseconds;
    return age > kCoarseStampNanoseconds;
}

}  // namespace

FSGatherWitness& FSGatherWitness::shared() {
    // Never destroyed: a listing may outlast the end of main.
    static FSGatherWitness& witness = *new FSGatherWitness;
    return witness;
}

std::string FSGatherWitness::keyOf(const std::vector<KsURL>& urls, std::uint64_t eventID) {
    std::string key = std::to_string(eventID);
    for (const KsURL& url : urls) {
        key += '\0';  // In no path.
        key += url.path();
    }
    return key;
}

FSGatherWitness::Listing* FSGatherWitness::find(const std::string& key) {
    const auto found = listings_.find(key);
    if (found == listings_.end()) return nullptr;
    found->second.lastUse = ++uses_;
    return &found->second;
}

void FSGatherWitness::drain() {
    const Result<void> drained = watch_.drain([this](int watch) NO_THREAD_SAFETY_ANALYSIS {
        if (watch == 0) {
            for (auto& [key, listing] : listings_) listing.changed = true;
            return;
        }
        const auto watchers = watchers_.find(watch);
        if (watchers == watchers_.end()) return;
        for (Listing* listing : watchers->second) listing->changed = true;
    });
    if (drained.ok()) return;
    for (auto& [key, listing] : listings_) listing.changed = true;
}

bool FSGatherWitness::isUnchanged(const Listing& listing) {
    drain();
    if (listing.changed) return false;
    return std::ranges::all_of(listing.heldToTheirTimes, [](const auto& held) {
        return isSame(KsURL::fileURL(held.first).status(), held.second);
    });
}

void FSGatherWitness::removeOldest() {
    const auto oldest = std::ranges::min_element(listings_, {}, [](const auto& entry) { return entry.second.lastUse; });
    watches_ -= oldest->second.watches.size();
    for (const int watch : oldest->second.watches) {
        const auto watchers = watchers_.find(watch);
        std::erase(watchers->second, &oldest->second);
        if (!watchers->second.empty()) continue;
        watch_.remove(watch);
        watchers_.erase(watchers);
    }
    listings_.erase(oldest);
}

Result<std::uint64_t> FSGatherWitness::begin(const std::vector<KsURL>& urls,
                                             std::span<const DirectoryReference* const> folders) {
    const MutexLock lock(mutex_);
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls.front());
    if (volume != namedIn_) {
        TRY(EventStream::noteChange());
        namedIn_ = volume;
    }
    std::uint64_t eventID = EventStream::currentEventID();
    const Listing* earlier = find(keyOf(urls, eventID));
    if (earlier != nullptr && !isUnchanged(*earlier)) eventID = TRY(EventStream::noteChange());
    if (earlier == nullptr && listings_.size() >= kListingsMax) removeOldest();
    // What was lost before it began is nothing to the new listing.
    drain();
    Listing& listing = listings_[keyOf(urls, eventID)];
    listing.lastUse = ++uses_;
    for (const DirectoryReference* folder : folders) see(listing, urls, *folder);
    return eventID;
}

/// Watches the folder for the listing. False when it can't be watched.
bool FSGatherWitness::watch(Listing& listing, const DirectoryReference& folder) {
    if (watches_ >= kWatchesMax) return false;
    const Result<int> watch = watch_.add(folder.fd.get());
    if (!watch.ok()) return false;
    ++watches_;
    listing.watches.push_back(*watch);
    watchers_[*watch].push_back(&listing);
    // What happened between the first look at the folder and the watch shows in its times.
    if (!isProvable(folder) || !isSame(sys::statx(folder.fd.get(), ""), folder.status)) listing.changed = true;
    return true;
}

void FSGatherWitness::see(Listing& listing, const std::vector<KsURL>& urls, const DirectoryReference& folder) {
    // The first sight stays: what a later page saw of the folder is checked against it.
    if (!listing.folders.insert(folder.status.fileID).second) return;
    const bool isListed = std::ranges::any_of(urls, [&](const KsURL& url) { return url.path() == folder.path; });
    if (!isListed && watch(listing, folder)) return;
    listing.heldToTheirTimes.emplace(folder.path, folder.status);
    if (!isProvable(folder)) listing.changed = true;
}

void FSGatherWitness::sawFolders(const std::vector<KsURL>& urls, std::uint64_t eventID,
                                 std::span<const DirectoryReference* const> folders) {
    const MutexLock lock(mutex_);
    Listing* listing = find(keyOf(urls, eventID));
    if (listing == nullptr) return;
    for (const DirectoryReference* folder : folders) see(*listing, urls, *folder);
}

bool FSGatherWitness::holds(const std::vector<KsURL>& urls, std::uint64_t eventID) {
    const MutexLock lock(mutex_);
    const Listing* listing = find(keyOf(urls, eventID));
    return listing != nullptr && !listing->folders.empty() && isUnchanged(*listing);
}

}  // namespace cindral
