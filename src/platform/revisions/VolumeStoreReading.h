#pragma once

#include <algorithm>
#include <array>
#include <optional>

#include "platform/revisions/VolumeStoreImplementation.h"
#include "platform/revisions/VolumeStoreUpdate.h"

// How the store's parts read what it holds: first what is not in the tables yet, then the tables.

namespace cindral {

/// Records that are looked up at once: enough that memory is never waited for, few enough to stay in the nearest cache.
inline constexpr std::size_t kLookupsAtOnceMax = 128;

/// Reads records one by one.
class VolumeStore::Implementation::Reader {
public:
    explicit Reader(const Implementation& store) : store_(store) {}

    /// Calls `use` with the record and answers true, or answers false when there is none. `use` may be called under the
    /// store's lock.
    template <typename Use>
    bool read(FileID fileID, Use use) {
        {
            const MutexLock lock(store_.mutex_);
            if (const Overlay::State state = store_.findUnsaved(fileID); state.isKnown) {
                if (state.record) use(*state.record);
                return state.record.has_value();
            }
            if (saved_ != store_.frozenCountSaved_) snapshot_.reset();
            saved_ = store_.frozenCountSaved_;
        }
        if (!snapshot_) snapshot_.emplace(*store_.tables_);
        const auto record = snapshot_->object(fileID);
        if (record) use(*record);
        return record.has_value();
    }

private:
    const Implementation& store_;
    std::optional<ObjectTables::Snapshot> snapshot_;
    std::uint64_t saved_ = 0;
};

/// Calls `use` with the place of each file ID and its record, or null; for some of them under the store's lock.
template <typename FileIDAt, typename Use>
Result<void> VolumeStore::Implementation::lookUp(std::size_t count, FileIDAt fileIDAt, Use use) const {
    std::array<tablepages::Lookup, kLookupsAtOnceMax> lookups;
    std::array<std::size_t, kLookupsAtOnceMax> places;
    for (std::size_t begin = 0; begin < count; begin += kLookupsAtOnceMax) {
        const std::size_t end = std::min(count, begin + kLookupsAtOnceMax);
        std::size_t missing = 0;
        {
            const MutexLock lock(mutex_);
            for (std::size_t i = begin; i < end; ++i) {
                const FileID fileID = fileIDAt(i);
                if (const Overlay::State state = findUnsaved(fileID); state.isKnown) {
                    use(i, state.record ? &*state.record : nullptr);
                } else {
                    lookups[missing].key = static_cast<std::uint64_t>(fileID);
                    places[missing++] = i;
                }
            }
        }
        if (missing == 0) continue;
        // After the overlays: what leaves them is in the tables before.
        const ObjectTables::Snapshot snapshot(*tables_);
        TRY(snapshot.objects(std::span(lookups).first(missing)));
        for (std::size_t i = 0; i < missing; ++i) {
            const auto record = lookups[i].found ? PackedRecord::decode(lookups[i].value) : std::nullopt;
            use(places[i], record ? &*record : nullptr);
        }
    }
    return {};
}

template <typename FileIDAt>
Result<void> VolumeStore::Implementation::Update::load(std::size_t count, FileIDAt fileIDAt) {
    return store_.lookUp(count, fileIDAt, [&](std::size_t i, const PackedRecord* record) {
        if (find(fileIDAt(i)) == nullptr) add(fileIDAt(i), record);
    });
}

/// A path put together from its end.
class BackwardsPath {
public:
    void prepend(std::string_view name) {
        const std::size_t needed = name.size() + (isEmpty() ? 0 : 1);
        if (needed > begin_) grow(needed);
        if (!isEmpty()) text_[--begin_] = '/';
        begin_ -= name.size();
        name.copy(text_.data() + begin_, name.size());
        hasNames_ = true;
    }
    std::string take() { return std::move(text_.erase(0, begin_)); }

private:
    bool isEmpty() const { return !hasNames_; }
    void grow(std::size_t needed) {
        const std::size_t more = text_.size() + needed;
        text_.insert(0, more, '\0');
        begin_ += more;
    }

    std::string text_ = std::string(256, '\0');
    std::size_t begin_ = 256;
    bool hasNames_ = false;
};

/// A chain this long is no path that the file system could have made; one in a circle gets here, too.
inline constexpr std::size_t kPathDepthMax = 4096;

/// What a record of any age may hold is checked before it becomes part of a path.
inline bool isFileName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

inline IndexedObject indexedObject(FileID fileID, const PackedRecord& record) {
    return {.fileID = fileID,
            .birthTime = record.birthTime,
            .parent = record.parent,
            .name = record.name,
            .kind = record.kind,
            .changeTime = record.changeTime,
            .size = record.size,
            .isClosed = record.isClosed,
            .hasOtherNames = record.hasOtherNames,
            .documentID = record.documentID,
            .isListed = record.isListed,
            .eventID = record.eventID};
}

}  // namespace cindral
