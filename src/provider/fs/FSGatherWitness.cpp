#include "provider/fs/FSGatherWitness.h"

#include <sys/utsname.h>

#include <algorithm>
#include <cstdio>

#include "platform/eventstream/EventStream.h"

namespace cindral {

namespace {

constexpr std::size_t kListingsMax = 64;
// For one listing; the user's limit is for all programs.
constexpr std::size_t kWatchesMax = 16'384;
// Twice the longest clock tick of the kernels that stamp files by the tick.
constexpr std::int64_t kCoarseStampNanoseconds = 20'000'000;

/// Since 6.13 a stamp that was looked at is followed by a distinct one, however soon the next change comes.
bool kernelStampsAreDistinct() {
    static const bool distinct = [] {
        utsname name{};
        int major = 0;
        int minor = 0;
        if (::uname(&name) != 0 || std::sscanf(name.release, "%d.%d", &major, &minor) != 2) return false;
        return major > 6 || (major == 6 && minor >= 13);
    }();
    return distinct;
}

bool isSame(const Result<FileStatus>& now, const FileStatus& seen) {
    return now.ok() && now->fileID == seen.fileID && now->device == seen.device &&
           now->modificationTime == seen.modificationTime && now->changeTime == seen.changeTime;
}

bool isProvable(const FileStatus& status) {
    if (kernelStampsAreDistinct()) return true;
    const KsDate now = KsDate::now();
    const std::int64_t age =
        (now.seconds - status.changeTime.seconds) * 1'000'000'000 + now.nanoseconds - status.changeTime.nanoseconds;
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
    for (const int watch : oldest->second.watches) {
        const auto watchers = watchers_.find(watch);
        std::erase(watchers->second, &oldest->second);
        if (!watchers->second.empty()) continue;
        watch_.remove(watch);
        watchers_.erase(watchers);
    }
    listings_.erase(oldest);
}

std::uint64_t FSGatherWitness::begin(const std::vector<KsURL>& urls) {
    const MutexLock lock(mutex_);
    std::uint64_t eventID = EventStream::currentEventID();
    std::string key = keyOf(urls, eventID);
    if (const Listing* earlier = find(key)) {
        if (isUnchanged(*earlier)) return eventID;
        const Result<std::uint64_t> next = EventStream::noteChange();
        // Without a new position the earlier listing can't be told from this one: neither may go on.
        if (!next.ok()) return eventID;
        eventID = *next;
        key = keyOf(urls, eventID);
    }
    if (listings_.size() >= kListingsMax) removeOldest();
    // What was lost before it began is nothing to the new listing.
    drain();
    listings_[key].lastUse = ++uses_;
    return eventID;
}

/// Watches the folder for the listing. False when it can't be watched.
bool FSGatherWitness::watch(Listing& listing, const DirectoryReference& folder) {
    if (listing.watches.size() >= kWatchesMax) return false;
    const Result<int> watch = watch_.add(folder.fd.get());
    if (!watch.ok()) return false;
    listing.watches.push_back(*watch);
    watchers_[*watch].push_back(&listing);
    // What happened between the first look at the folder and the watch shows in its times.
    if (!isProvable(folder.status) || !isSame(sys::statx(folder.fd.get(), ""), folder.status)) listing.changed = true;
    return true;
}

void FSGatherWitness::sawFolder(const std::vector<KsURL>& urls, std::uint64_t eventID,
                                const DirectoryReference& folder) {
    const MutexLock lock(mutex_);
    Listing* listing = find(keyOf(urls, eventID));
    // The first sight stays: what a later page saw of the folder is checked against it.
    if (listing == nullptr || !listing->folders.insert(folder.status.fileID).second) return;
    const bool isListed = std::ranges::any_of(urls, [&](const KsURL& url) { return url.path() == folder.path; });
    if (!isListed && watch(*listing, folder)) return;
    listing->heldToTheirTimes.emplace(folder.path, folder.status);
    if (!isProvable(folder.status)) listing->changed = true;
}

bool FSGatherWitness::holds(const std::vector<KsURL>& urls, std::uint64_t eventID) {
    const MutexLock lock(mutex_);
    const Listing* listing = find(keyOf(urls, eventID));
    return listing != nullptr && !listing->folders.empty() && isUnchanged(*listing);
}

}  // namespace cindral
