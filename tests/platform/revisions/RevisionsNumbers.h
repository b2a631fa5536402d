#pragma once

#include <cstdint>

#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// The folder above everything in the tests of the store.
inline constexpr FileID kRoot{2};

inline std::uint64_t number(FileID id) {
    return static_cast<std::uint64_t>(id);
}

inline std::uint32_t number(DocumentID id) {
    return static_cast<std::uint32_t>(id);
}

}  // namespace cindral
