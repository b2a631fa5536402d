#pragma once

#include <cstddef>
#include <string_view>

namespace cindral {

/// The beginning of a text that is UTF-8, or is meant to be.
struct Utf8Step {
    std::size_t length = 0;  ///< bytes of the character, or of the bytes that one U+FFFD stands for
    char32_t character = 0;  ///< meaningless where `isValid` is false
    bool isValid = false;
};

/// Reads the first character of a text that is not empty.
///
/// What is no character is cut where the Unicode standard recommends (maximal subparts): the longest beginning of a
/// well-formed sequence, or else one byte. So every decoder that follows it shows the same number of U+FFFD.
Utf8Step utf8Step(std::string_view text);

bool isUtf8(std::string_view text);

/// Only letters of ASCII have case here, whatever the locale says.
constexpr bool isUpperASCII(char c) {
    return c >= 'A' && c <= 'Z';
}
constexpr char lowerASCII(char c) {
    return isUpperASCII(c) ? static_cast<char>(c - 'A' + 'a') : c;
}

}  // namespace cindral
