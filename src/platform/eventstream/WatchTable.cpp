#include "platform/eventstream/WatchTable.h"

#include <algorithm>
#include <utility>

namespace cindral {

namespace {

constexpr std::size_t kBucketsMin = 16;

std::uint64_t numberOf(FileID object) {
    return static_cast<std::uint64_t>(object);
}

}  // namespace

std::size_t WatchTable::bucket(std::uint64_t number) const {
    // Numbers that follow each other, as watches and inodes do, are spread over all bits.
    number ^= number >> 32;
    number *= 0x9E37'79B9'7F4A'7C15;
    return (number >> 32) & (byWatch_.size() - 1);
}

WatchTable::Place WatchTable::placeOf(FileID object) const {
    if (count_ == 0) return kNone;
    Place place = byObject_[bucket(numberOf(object))];
    while (place != kNone && entries_[place].object != object) place = entries_[place].nextOfObject;
    return place;
}

void WatchTable::link(Place place) {
    Entry& entry = entries_[place];
    Place& ofWatch = byWatch_[bucket(entry.watch)];
    Place& ofObject = byObject_[bucket(numberOf(entry.object))];
    entry.nextOfWatch = std::exchange(ofWatch, place);
    entry.nextOfObject = std::exchange(ofObject, place);
}

void WatchTable::unlink(Place place) {
    const Entry& entry = entries_[place];
    Place* at = &byWatch_[bucket(entry.watch)];
    while (*at != place) at = &entries_[*at].nextOfWatch;
    *at = entry.nextOfWatch;
    at = &byObject_[bucket(numberOf(entry.object))];
    while (*at != place) at = &entries_[*at].nextOfObject;
    *at = entry.nextOfObject;
}

void WatchTable::grow() {
    // Only when no place is free: every entry is one of the table's.
    const std::size_t buckets = std::max(kBucketsMin, byWatch_.size() * 2);
    byWatch_.assign(buckets, kNone);
    byObject_.assign(buckets, kNone);
    for (Place place = 0; place < entries_.size(); ++place) link(place);
}

std::optional<std::uint64_t> WatchTable::set(FileID object, std::uint64_t watch) {
    if (const Place known = placeOf(object); known != kNone && entries_[known].watch == watch) return std::nullopt;
    const auto before = remove(object);
    Place place = firstFree_;
    if (place != kNone) {
        firstFree_ = entries_[place].nextOfWatch;
    } else {
        if (entries_.size() == byWatch_.size()) grow();
        place = static_cast<Place>(entries_.size());
        entries_.emplace_back();
    }
    entries_[place] = {.watch = watch, .object = object};
    link(place);
    ++count_;
    return before;
}

std::optional<std::uint64_t> WatchTable::remove(FileID object) {
    const Place place = placeOf(object);
    if (place == kNone) return std::nullopt;
    unlink(place);
    --count_;
    entries_[place].nextOfWatch = std::exchange(firstFree_, place);
    return entries_[place].watch;
}

void WatchTable::find(std::uint64_t watch, std::vector<FileID>& found) const {
    found.clear();
    if (count_ == 0) return;
    for (Place place = byWatch_[bucket(watch)]; place != kNone; place = entries_[place].nextOfWatch) {
        if (entries_[place].watch == watch) found.push_back(entries_[place].object);
    }
}

bool WatchTable::contains(std::uint64_t watch) const {
    if (count_ == 0) return false;
    Place place = byWatch_[bucket(watch)];
    while (place != kNone && entries_[place].watch != watch) place = entries_[place].nextOfWatch;
    return place != kNone;
}

}  // namespace cindral
