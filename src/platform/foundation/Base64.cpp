#include "platform/foundation/Base64.h"

#include <array>
#include <cstdint>

namespace cindral {

namespace {

constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr std::uint8_t kNoDigit = 0xFF;

constexpr auto kDigitValues = [] {
    std::array<std::uint8_t, 256> values{};
    values.fill(kNoDigit);
    for (std::size_t i = 0; i < kAlphabet.size(); ++i) {
        values[static_cast<std::uint8_t>(kAlphabet[i])] = static_cast<std::uint8_t>(i);
    }
    return values;
}();

constexpr char digit(std::uint32_t value) {
    return kAlphabet[value & 0x3F];
}

std::uint32_t byteAt(ByteView bytes, std::size_t index) {
    return std::to_integer<std::uint32_t>(bytes[index]);
}

/// The 24 bits of four digits, or a number with higher bits when one of them is none.
std::uint32_t group(const char* digits) {
    std::uint32_t bits = 0;
    std::uint32_t bad = 0;
    for (int i = 0; i < 4; ++i) {
        const std::uint8_t value = kDigitValues[static_cast<std::uint8_t>(digits[i])];
        bad |= value & 0x80U;
        bits = bits << 6 | (value & 0x3FU);
    }
    return bits | bad << 24;
}

constexpr std::uint32_t kBadGroup = 0x8000'0000;

}  // namespace

void appendBase64(std::string& out, ByteView bytes) {
    const std::size_t begin = out.size();
    out.resize(begin + (bytes.size() + 2) / 3 * 4);
    char* to = out.data() + begin;
    std::size_t from = 0;
    for (; from + 3 <= bytes.size(); from += 3) {
        const std::uint32_t bits = byteAt(bytes, from) << 16 | byteAt(bytes, from + 1) << 8 | byteAt(bytes, from + 2);
        *to++ = digit(bits >> 18);
        *to++ = digit(bits >> 12);
        *to++ = digit(bits >> 6);
        *to++ = digit(bits);
    }
    const std::size_t left = bytes.size() - from;
    if (left == 0) return;
    const std::uint32_t bits = byteAt(bytes, from) << 16 | (left == 2 ? byteAt(bytes, from + 1) << 8 : 0);
    *to++ = digit(bits >> 18);
    *to++ = digit(bits >> 12);
    *to++ = left == 2 ? digit(bits >> 6) : '=';
    *to++ = '=';
}

std::string base64Encode(ByteView bytes) {
    std::string text;
    appendBase64(text, bytes);
    return text;
}

std::optional<Bytes> base64Decode(std::string_view text) {
    if (text.size() % 4 != 0) return std::nullopt;
    const std::size_t padding = text.ends_with("==") ? 2 : text.ends_with('=') ? 1 : 0;
    Bytes bytes(text.size() / 4 * 3 - padding);
    std::size_t at = 0;
    const std::size_t wholeGroups = padding == 0 ? text.size() : text.size() - 4;
    for (std::size_t from = 0; from < wholeGroups; from += 4) {
        const std::uint32_t bits = group(text.data() + from);
        if (bits & kBadGroup) return std::nullopt;
        bytes[at++] = static_cast<std::byte>(bits >> 16);
        bytes[at++] = static_cast<std::byte>(bits >> 8);
        bytes[at++] = static_cast<std::byte>(bits);
    }
    if (padding == 0) return bytes;

    // The last group with its padding read as zeros. Bits below the last byte would be lost, so there must be none.
    std::array<char, 4> last{'A', 'A', 'A', 'A'};
    text.copy(last.data(), 4 - padding, wholeGroups);
    const std::uint32_t bits = group(last.data());
    const std::uint32_t strayBits = padding == 1 ? 0xFF : 0xFFFF;
    if ((bits & kBadGroup) || (bits & strayBits)) return std::nullopt;
    bytes[at++] = static_cast<std::byte>(bits >> 16);
    if (padding == 1) bytes[at++] = static_cast<std::byte>(bits >> 8);
    return bytes;
}

}  // namespace cindral
