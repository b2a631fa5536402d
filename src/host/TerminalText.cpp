#include "host/TerminalText.h"

#include <fmt/format.h>

#include <array>
#include <ctime>

#include "platform/foundation/Utf8.h"

namespace cindral {
namespace {

bool isHarmless(char32_t character) {
    if (character < 0x20 || (character >= 0x7F && character < 0xA0))
        return false;                                              // C0, delete, C1: terminals obey them.
    if (character == 0x2028 || character == 0x2029) return false;  // Line and paragraph separators.
    if (character == 0x200E || character == 0x200F || character == 0x061C) return false;
    // Embeddings, overrides and isolates: "gpj.exe" must not look like "exe.jpg".
    return !(character >= 0x202A && character <= 0x202E) && !(character >= 0x2066 && character <= 0x2069);
}

void appendHex(std::string& out, std::string_view bytes) {
    for (const char byte : bytes) fmt::format_to(std::back_inserter(out), "\\x{:02X}", static_cast<std::uint8_t>(byte));
}

std::string formatted(const KsDate& date, const char* format) {
    const auto seconds = static_cast<std::time_t>(date.seconds);
    std::tm local{};
    // Years that the C library can't count.
    if (::localtime_r(&seconds, &local) == nullptr) return "?";
    std::array<char, 64> text{};
    return {text.data(), std::strftime(text.data(), text.size(), format, &local)};
}

}  // namespace

void appendTerminalText(std::string& out, std::string_view text) {
    while (!text.empty()) {
        const Utf8Step step = utf8Step(text);
        const std::string_view bytes = text.substr(0, step.length);
        if (!step.isValid || !isHarmless(step.character)) {
            appendHex(out, bytes);
        } else if (step.character == U'\\') {
            out += "\\\\";
        } else {
            out += bytes;
        }
        text.remove_prefix(step.length);
    }
}

std::string terminalText(std::string_view text) {
    std::string out;
    appendTerminalText(out, text);
    return out;
}

std::string counted(std::uint64_t count, std::string_view one, std::string_view many) {
    return fmt::format("{} {}", count, count == 1 ? one : many);
}

std::string humanSize(std::uint64_t bytes) {
    if (bytes < 1000) return fmt::format("{} B", bytes);
    // In tenths of the unit, so that what is shown is decided by integers: 999,950 is "1.0 MB", not "1000 kB".
    constexpr std::array<std::string_view, 6> kUnits{"kB", "MB", "GB", "TB", "PB", "EB"};
    std::uint64_t divisor = 1000;
    for (const std::string_view unit : kUnits) {
        const std::uint64_t tenths = bytes / (divisor / 10) + (bytes % (divisor / 10) >= divisor / 20 ? 1 : 0);
        if (tenths < 100) return fmt::format("{}.{} {}", tenths / 10, tenths % 10, unit);
        const std::uint64_t whole = bytes / divisor + (bytes % divisor >= divisor / 2 ? 1 : 0);
        if (whole < 1000) return fmt::format("{} {}", whole, unit);
        divisor *= 1000;
    }
    return fmt::format("{} B", bytes);  // Not reached: 64 bits end at 18 EB.
}

std::string humanMinute(const KsDate& date) {
    return formatted(date, "%Y-%m-%d %H:%M");
}

std::string humanMoment(const KsDate& date) {
    return formatted(date, "%Y-%m-%d %H:%M:%S %z");
}

}  // namespace cindral
