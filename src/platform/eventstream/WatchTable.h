#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <vector>

#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Which watch stands for which object, found from both sides.
///
/// A watch is known by a number that the source of events chooses. An object has one watch; where the number is a digest,
/// two objects may share it, and then both are found. About 36 bytes a watch, because there is one for each folder.
///
/// Thread safety: one thread at a time.
class WatchTable {
public:
    /// The object's watch from now on. Answers the one that it had before, where that was another.
    std::optional<std::uint64_t> set(FileID object, std::uint64_t watch);
    /// Answers the watch that the object had.
    std::optional<std::uint64_t> remove(FileID object);
    /// Puts the objects of a watch into `found`, in place of what is there.
    void find(std::uint64_t watch, std::vector<FileID>& found) const;
    bool contains(std::uint64_t watch) const;
    std::size_t size() const { return count_; }

private:
    using Place = std::uint32_t;
    static constexpr Place kNone = 0xFFFF'FFFF;

    struct Entry {
        std::uint64_t watch = 0;
        FileID object{};
        Place nextOfWatch = kNone;  // In the chain of its bucket; of a free place, the next free one.
        Place nextOfObject = kNone;
    };

    std::size_t bucket(std::uint64_t number) const;
    Place placeOf(FileID object) const;
    void link(Place place);
    void unlink(Place place);
    void grow();

    std::deque<Entry> entries_;  // Not a vector, which would have to hold everything twice to grow.
    std::vector<Place> byWatch_;
    std::vector<Place> byObject_;
    Place firstFree_ = kNone;
    std::size_t count_ = 0;
};

}  // namespace cindral
