#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"

namespace cindral {

/// Standard base64 with padding.
std::string base64Encode(ByteView bytes);
void appendBase64(std::string& out, ByteView bytes);
/// None for anything that base64Encode would not have written (another alphabet, missing padding, stray bits, white
/// space).
std::optional<Bytes> base64Decode(std::string_view text);

}  // namespace cindral
