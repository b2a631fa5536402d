#pragma once

#include <cstdint>

#include "platform/foundation/Data.h"

namespace cindral {

/// CRC-32C (Castagnoli) of the bytes. Pass the checksum of what came before to go on with it.
///
/// Finds torn and bit-flipped writes; no protection against somebody who means it.
std::uint32_t crc32c(ByteView bytes, std::uint32_t before = 0);

}  // namespace cindral
