#include "platform/revisions/Overlay.h"

#include <sys/mman.h>

#include <algorithm>
#include <bit>
#include <new>

namespace cindral {

namespace {

constexpr std::size_t kChunkBytes = std::size_t{256} * 1024;
constexpr std::size_t kSlotsMin = 64;

// In memory only: file ID u64, size of the packed record u16, the packed record.
constexpr std::size_t kEntryHeadBytes = 10;

FileID entryKey(const std::byte* entry) {
    return FileID{loadInteger<std::uint64_t>(entry)};
}

ByteView entryRecord(const std::byte* entry) {
    return {entry + kEntryHeadBytes, loadInteger<std::uint16_t>(entry + 8)};
}

}  // namespace

void Overlay::Unmap::operator()(std::byte* chunk) const {
    ::munmap(chunk, kChunkBytes);
}

std::byte* Overlay::allocate(std::size_t size) {
    if (size > chunkLeft_) {
        // Mapped, not from the heap: what no record has touched is no memory yet, and what an overlay had is given
        // back when it goes.
        void* chunk = ::mmap(nullptr, kChunkBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (chunk == MAP_FAILED) throw std::bad_alloc();
        chunks_.emplace_back(static_cast<std::byte*>(chunk));
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
    while (slots_[slot] != nullptr && entryKey(slots_[slot]) != fileID) slot = (slot + 1) & mask;
    return slot;
}

void Overlay::grow() {
    std::vector<const std::byte*> old(std::max(kSlotsMin, slots_.size() * 2));
    old.swap(slots_);
    for (const std::byte* entry : old) {
        if (entry != nullptr) slots_[slotOf(entryKey(entry))] = entry;
    }
}

void Overlay::put(FileID fileID, const PackedRecord& record) {
    if (count_ * 4 >= slots_.size() * 3) grow();
    std::byte* entry = allocate(kEntryHeadBytes + record.size());
    storeInteger(entry, static_cast<std::uint64_t>(fileID));
    storeInteger(entry + 8, static_cast<std::uint16_t>(record.size()));
    record.encode(entry + kEntryHeadBytes);
    const std::byte*& slot = slots_[slotOf(fileID)];
    if (slot == nullptr) ++count_;
    slot = entry;
}

void Overlay::addDocument(DocumentID documentID, const DocumentRecord& document) {
    documents_.emplace_back(documentID, document);
}

std::optional<PackedRecord> Overlay::find(FileID fileID) const {
    if (count_ == 0) return std::nullopt;
    const std::byte* entry = slots_[slotOf(fileID)];
    return entry != nullptr ? PackedRecord::decode(entryRecord(entry)) : std::nullopt;
}

std::optional<DocumentRecord> Overlay::findDocument(DocumentID documentID) const {
    const auto found = std::ranges::lower_bound(documents_, documentID, {}, &Document::first);
    if (found == documents_.end() || found->first != documentID) return std::nullopt;
    return found->second;
}

std::vector<Overlay::Object> Overlay::objectsInKeyOrder() const {
    std::vector<Object> objects;
    objects.reserve(count_);
    for (const std::byte* entry : slots_) {
        if (entry != nullptr) objects.emplace_back(entryKey(entry), entryRecord(entry));
    }
    std::ranges::sort(objects, {}, &Object::first);
    return objects;
}

}  // namespace cindral
