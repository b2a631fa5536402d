#include "platform/foundation/KsUUID.h"

#include <sys/random.h>

#include <cerrno>

#include "platform/foundation/Fatal.h"

namespace cindral {

namespace {

// Dashes stand before these bytes of the 16.
constexpr bool dashBefore(std::size_t byte) {
    return byte == 4 || byte == 6 || byte == 8 || byte == 10;
}

constexpr std::size_t kTextLength = 36;

/// 0 to 15, or a number above for what is no hexadecimal digit.
constexpr unsigned hexDigitValue(char character) {
    if (character >= '0' && character <= '9') return static_cast<unsigned>(character - '0');
    if (character >= 'A' && character <= 'F') return static_cast<unsigned>(character - 'A' + 10);
    if (character >= 'a' && character <= 'f') return static_cast<unsigned>(character - 'a' + 10);
    return 16;
}

}  // namespace

KsUUID KsUUID::random() {
    KsUUID uuid;
    // So few bytes come whole or, while the system starts, not at all (EINTR).
    while (::getrandom(uuid.bytes.data(), uuid.bytes.size(), 0) != static_cast<ssize_t>(uuid.bytes.size())) {
        if (errno != EINTR) fatal("the kernel has no random bytes");
    }
    uuid.bytes[6] = static_cast<std::uint8_t>((uuid.bytes[6] & 0x0F) | 0x40);  // Version 4.
    uuid.bytes[8] = static_cast<std::uint8_t>((uuid.bytes[8] & 0x3F) | 0x80);  // The variant that has versions.
    return uuid;
}

std::string KsUUID::string() const {
    constexpr std::string_view kDigits = "0123456789ABCDEF";
    std::string text(kTextLength, '-');
    std::size_t at = 0;
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        if (dashBefore(i)) ++at;
        text[at++] = kDigits[bytes[i] >> 4];
        text[at++] = kDigits[bytes[i] & 0x0F];
    }
    return text;
}

std::optional<KsUUID> KsUUID::parse(std::string_view text) {
    if (text.size() != kTextLength) return std::nullopt;
    KsUUID uuid;
    std::size_t at = 0;
    for (std::size_t i = 0; i < uuid.bytes.size(); ++i) {
        if (dashBefore(i) && text[at++] != '-') return std::nullopt;
        const unsigned high = hexDigitValue(text[at++]);
        const unsigned low = hexDigitValue(text[at++]);
        if (high > 15 || low > 15) return std::nullopt;
        uuid.bytes[i] = static_cast<std::uint8_t>(high << 4 | low);
    }
    return uuid;
}

}  // namespace cindral
