#include "platform/foundation/Utf8.h"

#include <array>
#include <cstdint>

namespace cindral {
namespace {

/// What may follow a lead byte: the range of the second byte closes the doors to overlong forms, surrogates and what is
/// beyond U+10FFFF; later bytes are always 80 to BF.
struct Lead {
    std::uint8_t length;
    std::uint8_t secondMin;
    std::uint8_t secondMax;
};

constexpr Lead leadOf(std::uint8_t byte) {
    if (byte >= 0xC2 && byte <= 0xDF) return {2, 0x80, 0xBF};
    if (byte == 0xE0) return {3, 0xA0, 0xBF};
    if (byte == 0xED) return {3, 0x80, 0x9F};
    if (byte >= 0xE1 && byte <= 0xEF) return {3, 0x80, 0xBF};
    if (byte == 0xF0) return {4, 0x90, 0xBF};
    if (byte >= 0xF1 && byte <= 0xF3) return {4, 0x80, 0xBF};
    if (byte == 0xF4) return {4, 0x80, 0x8F};
    return {0, 0, 0};
}

std::uint8_t byteAt(std::string_view text, std::size_t index) {
    return static_cast<std::uint8_t>(text[index]);
}

}  // namespace

Utf8Step utf8Step(std::string_view text) {
    const std::uint8_t first = byteAt(text, 0);
    if (first < 0x80) return {1, first, true};
    const Lead lead = leadOf(first);
    if (lead.length == 0) return {1, 0, false};

    constexpr std::array<std::uint8_t, 5> kLeadBits{0, 0, 0x1F, 0x0F, 0x07};
    char32_t character = first & kLeadBits[lead.length];
    for (std::size_t i = 1; i < lead.length; ++i) {
        const std::uint8_t min = i == 1 ? lead.secondMin : 0x80;
        const std::uint8_t max = i == 1 ? lead.secondMax : 0xBF;
        if (i >= text.size() || byteAt(text, i) < min || byteAt(text, i) > max) return {i, 0, false};
        character = character << 6 | (byteAt(text, i) & 0x3FU);
    }
    return {lead.length, character, true};
}

bool isUtf8(std::string_view text) {
    while (!text.empty()) {
        const Utf8Step step = utf8Step(text);
        if (!step.isValid) return false;
        text.remove_prefix(step.length);
    }
    return true;
}

}  // namespace cindral
