#include "platform/revisions/Overlay.h"

#include <sys/mman.h>

#include <algorithm>
#include <bit>
#include <cstring>
#include <limits>
#include <new>

namespace cindral {

namespace {

constexpr std::size_t kChunkBytes = std::size_t{256} * 1024;
constexpr std::size_t kSlotsMin = 64;

// In memory only: file ID u64, hash of the name u32, size of the packed record u16 (0: gone), the packed record.
constexpr std::size_t kEntryHeadBytes = 14;

// What a node of a map or a set costs beside what is in it.
constexpr std::size_t kNodeBytes = 64;

}  // namespace

FileID Overlay::keyOf(const std::byte* entry) {
    return FileID{loadInteger<std::uint64_t>(entry)};
}

std::uint32_t Overlay::hashOf(const std::byte* entry) {
    return loadInteger<std::uint32_t>(entry + 8);
}

ByteView Overlay::packedOf(const std::byte* entry) {
    return {entry + kEntryHeadBytes, loadInteger<std::uint16_t>(entry + 12)};
}

void Overlay::Unmap::operator()(std::byte* chunk) const {
    ::munmap(chunk, bytes);
}

std::byte* Overlay::allocate(std::size_t size) {
    if (size > chunkLeft_) {
        // Mapped, not from the heap: what no record has touched is no memory yet, and what an overlay had is given
        // back when it goes.
        void* chunk = ::mmap(nullptr, kChunkBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (chunk == MAP_FAILED) throw std::bad_alloc();
        chunks_.push_back({static_cast<std::byte*>(chunk), Unmap{kChunkBytes}});
        chunkNext_ = chunks_.back().get();
        chunkLeft_ = kChunkBytes;
    }
    chunkLeft_ -= size;
    bytes_ += size;
    return std::exchange(chunkNext_, chunkNext_ + size);
}

/// Where the object is, or would be put.
std::size_t Overlay::slotOf(FileID fileID) const {
    const std::size_t mask = slots_.size() - 1;
    // Neighbouring numbers are the rule; the multiplication spreads them, its upper bits best.
    const std::uint64_t spread = static_cast<std::uint64_t>(fileID) * 0x9E3779B97F4A7C15;
    std::size_t slot = static_cast<std::size_t>(spread >> (64 - std::countr_zero(slots_.size())));
    while (slots_[slot] != nullptr && keyOf(slots_[slot]) != fileID) slot = (slot + 1) & mask;
    return slot;
}

void Overlay::grow() {
    std::vector<const std::byte*> old(std::max(kSlotsMin, slots_.size() * 2));
    old.swap(slots_);
    for (const std::byte* entry : old) {
        if (entry != nullptr) slots_[slotOf(keyOf(entry))] = entry;
    }
}

const std::byte* Overlay::newest(FileID fileID) const {
    return count_ == 0 ? nullptr : slots_[slotOf(fileID)];
}

std::byte* Overlay::addEntry(FileID fileID, std::uint32_t hash, std::size_t packedBytes) {
    if (count_ * 4 >= slots_.size() * 3) grow();
    std::byte* entry = allocate(kEntryHeadBytes + packedBytes);
    storeInteger(entry, static_cast<std::uint64_t>(fileID));
    storeInteger(entry + 8, hash);
    storeInteger(entry + 12, static_cast<std::uint16_t>(packedBytes));
    const std::byte*& slot = slots_[slotOf(fileID)];
    if (slot == nullptr) ++count_;
    slot = entry;
    return entry;
}

void Overlay::put(FileID fileID, const PackedRecord& record, std::uint32_t hash, bool isNewEvent) {
    const State before = find(fileID);
    std::byte* entry = addEntry(fileID, hash, record.encodedBytes());
    record.encode(entry + kEntryHeadBytes);
    addChildEntry(record.parent, hash, entry);
    if (!before.record || before.record->parent != record.parent) {
        arrivals_[record.parent].push_back(fileID);
        bytes_ += sizeof(FileID);
    }
    if (!isNewEvent) return;
    dropOldPresences();
    presences_.emplace_back(record.eventID, fileID);
    bytes_ += sizeof presences_[0];
}

void Overlay::putGone(FileID fileID) {
    addEntry(fileID, 0, 0);
}

Overlay::State Overlay::find(FileID fileID) const {
    const std::byte* entry = newest(fileID);
    if (entry == nullptr) return {};
    return {.isKnown = true, .record = PackedRecord::decode(packedOf(entry))};
}

std::size_t Overlay::childSlot(FileID parent, std::uint32_t hash, std::size_t slots) {
    const std::uint64_t spread = (static_cast<std::uint64_t>(parent) * 0x9E3779B97F4A7C15 + hash) * 0xD6E8FEB86659FD93;
    return static_cast<std::size_t>(spread >> (64 - std::countr_zero(slots)));
}

void Overlay::addChildEntry(FileID parent, std::uint32_t hash, const std::byte* entry) {
    if (childEntries_ * 4 >= childSlots_.size() * 3) growChildren();
    const std::size_t mask = childSlots_.size() - 1;
    std::size_t slot = childSlot(parent, hash, childSlots_.size());
    while (childSlots_[slot] != nullptr) slot = (slot + 1) & mask;
    childSlots_[slot] = entry;
    ++childEntries_;
}

void Overlay::growChildren() {
    std::vector<const std::byte*> old;
    old.swap(childSlots_);
    std::erase_if(old, [&](const std::byte* entry) { return entry == nullptr || !isNewest(entry); });
    childSlots_.assign(std::max(kSlotsMin, std::bit_ceil(old.size() * 2 + 1)), nullptr);
    childEntries_ = 0;
    for (const std::byte* entry : old) {
        if (const auto record = PackedRecord::decode(packedOf(entry)))
            addChildEntry(record->parent, hashOf(entry), entry);
    }
}

const std::vector<FileID>* Overlay::arrivals(FileID parent) const {
    const auto found = arrivals_.find(parent);
    return found != arrivals_.end() ? &found->second : nullptr;
}

void Overlay::addToChildCount(FileID parent, std::int64_t difference) {
    childCounts_[parent] += difference;
}

std::int64_t Overlay::childCountDifference(FileID parent) const {
    const auto found = childCounts_.find(parent);
    return found != childCounts_.end() ? found->second : 0;
}

/// An object that changes all the time shall not fill the list.
void Overlay::dropOldPresences() {
    if (presences_.size() < std::max<std::size_t>(64, presencesKept_ * 2)) return;
    std::erase_if(presences_, [&](const auto& presence) { return !isCurrent(presence); });
    presencesKept_ = presences_.size();
}

std::uint64_t Overlay::lastEvent() const {
    std::uint64_t last = 0;
    // What a log brings back need not be in order.
    for (const auto& [eventID, fileID] : presences_) last = std::max(last, eventID);
    if (!departures_.empty()) last = std::max(last, departures_.back().first);
    if (!documentChanges_.empty()) last = std::max(last, documentChanges_.back().first);
    return last;
}

std::uint64_t Overlay::firstEvent() const {
    std::uint64_t first = std::numeric_limits<std::uint64_t>::max();
    if (!presences_.empty()) first = std::min(first, presences_.front().first);
    if (!departures_.empty()) first = std::min(first, departures_.front().first);
    if (!documentChanges_.empty()) first = std::min(first, documentChanges_.front().first);
    return first;
}

bool Overlay::isCurrent(const std::pair<std::uint64_t, FileID>& presence) const {
    const auto record = find(presence.second).record;
    return record && record->eventID == presence.first;
}

void Overlay::addDocument(DocumentID documentID, const DocumentRecord& document) {
    bytes_ += sizeof(Document);
    if (documents_.empty() || documents_.back().first < documentID) {
        documents_.emplace_back(documentID, document);
        return;
    }
    const auto place = std::ranges::lower_bound(documents_, documentID, {}, &Document::first);
    if (place->first == documentID) {
        place->second = document;
    } else {
        documents_.insert(place, {documentID, document});
    }
}

void Overlay::handOver(DocumentID documentID, const DocumentRecord& document) {
    bytes_ += kNodeBytes + sizeof(Document);
    const auto given = std::ranges::lower_bound(documents_, documentID, {}, &Document::first);
    if (given != documents_.end() && given->first == documentID) {
        given->second = document;
    } else {
        handedOver_[documentID] = document;
    }
}

std::optional<DocumentRecord> Overlay::findDocument(DocumentID documentID) const {
    if (const auto found = handedOver_.find(documentID); found != handedOver_.end()) return found->second;
    const auto found = std::ranges::lower_bound(documents_, documentID, {}, &Document::first);
    if (found == documents_.end() || found->first != documentID) return std::nullopt;
    return found->second;
}

void Overlay::putAttributes(DocumentID documentID, ByteView attributes) {
    bytes_ += kNodeBytes + attributes.size();
    attributes_[documentID].assign(attributes.begin(), attributes.end());
}

void Overlay::putName(const NameKey& key, std::optional<std::string> name) {
    bytes_ += 2 * kNodeBytes + sizeof key + (name ? name->size() : 0);
    const Place place{key.parent, key.hash, key.fileID, key.index};
    if (name) {
        namePlaces_.insert(place);
    } else {
        namePlaces_.erase(place);
    }
    names_[key] = std::move(name);
}

void Overlay::addDeparture(std::uint64_t eventID, ByteView packed) {
    std::byte* kept = allocate(packed.size());
    std::memcpy(kept, packed.data(), packed.size());
    departures_.emplace_back(eventID, ByteView(kept, packed.size()));
    bytes_ += sizeof departures_[0];
}

void Overlay::addDocumentChange(std::uint64_t eventID, const DocumentChange& change) {
    documentChanges_.emplace_back(eventID, change);
    bytes_ += sizeof documentChanges_[0];
}

void Overlay::beginHistory(std::uint64_t eventID) {
    historyBegin_ = eventID;
    bytes_ += sizeof eventID;
}

std::vector<Overlay::Object> Overlay::objectsInKeyOrder() const {
    std::vector<Object> objects;
    objects.reserve(count_);
    for (const std::byte* entry : slots_) {
        if (entry != nullptr) objects.push_back({keyOf(entry), hashOf(entry), packedOf(entry)});
    }
    std::ranges::sort(objects, {}, &Object::fileID);
    return objects;
}

}  // namespace cindral
