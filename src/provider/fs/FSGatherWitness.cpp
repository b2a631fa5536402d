#include "provider/fs/FSGatherWitness.h"

#include <sys/utsname.h>

#include <algorithm>
#include <cstdio>

#include "platform/eventstream/EventStream.h"

namespace cindral {

namespace {

constexpr std::size_t kListingsMax = 64;
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

bool isProvable(const FileStatus& status) {
    if (kernelStampsAreDistinct()) return true;
    const KsDate now = KsDate::now();
    const std::int64_t age = (now.seconds - status.changeTime.seconds) * 1'000'000'000 + now.nanoseconds - status.changeTime.nanoseconds;
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

bool FSGatherWitness::isUnchanged(const Listing& listing) {
    return std::ranges::all_of(listing.folders, [](const auto& seen) {
        const auto& [path, folder] = seen;
        if (!folder.provable) return false;
        const Result<FileStatus> now = KsURL::fileURL(path).status();
        return now.ok() && now->fileID == folder.status.fileID && now->device == folder.status.device &&
               now->modificationTime == folder.status.modificationTime && now->changeTime == folder.status.changeTime;
    });
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
    if (listings_.size() >= kListingsMax) {
        listings_.erase(std::ranges::min_element(listings_, {}, [](const auto& entry) { return entry.second.lastUse; }));
    }
    Listing& listing = listings_[key];
    listing.lastUse = ++uses_;
    return eventID;
}

void FSGatherWitness::sawFolder(const std::vector<KsURL>& urls, std::uint64_t eventID, const DirectoryReference& folder) {
    const MutexLock lock(mutex_);
    // The first sight stays: what a later page saw of the folder is checked against it.
    if (Listing* listing = find(keyOf(urls, eventID))) listing->folders.try_emplace(folder.path, folder.status, isProvable(folder.status));
}

bool FSGatherWitness::holds(const std::vector<KsURL>& urls, std::uint64_t eventID) {
    const MutexLock lock(mutex_);
    const Listing* listing = find(keyOf(urls, eventID));
    return listing != nullptr && !listing->folders.empty() && isUnchanged(*listing);
}

}  // namespace cindral
