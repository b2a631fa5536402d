#pragma once

#include <string>
#include <string_view>

#include "platform/foundation/Data.h"

namespace cindral::test {

/// Bytes from hexadecimal digits; blanks and line ends between them only please the eye.
inline Bytes bytesFromHex(std::string_view text) {
    Bytes bytes;
    unsigned value = 0;
    unsigned digits = 0;
    for (const char c : text) {
        const auto digit = std::string_view("0123456789abcdef").find(c);
        if (digit == std::string_view::npos) continue;
        value = value << 4 | static_cast<unsigned>(digit);
        if (++digits % 2 == 0) bytes.push_back(static_cast<std::byte>(value));
    }
    return bytes;
}

inline std::string hexFromBytes(ByteView bytes) {
    std::string text;
    for (const std::byte byte : bytes) {
        text.push_back("0123456789abcdef"[std::to_integer<unsigned>(byte) >> 4]);
        text.push_back("0123456789abcdef"[std::to_integer<unsigned>(byte) & 0xF]);
    }
    return text;
}

}  // namespace cindral::test
