#include "host/JsonText.h"

#include <fmt/format.h>

#include <array>

#include "platform/foundation/Utf8.h"

namespace cindral {
namespace {

constexpr std::string_view kReplacementCharacter = "\xEF\xBF\xBD";
constexpr char kHexLower[] = "0123456789abcdef";
constexpr char kHexUpper[] = "0123456789ABCDEF";

/// Bytes that stand for themselves in a JSON string: printable ASCII but the quote and the backslash.
constexpr auto kPlainInJson = [] {
    std::array<bool, 256> plain{};
    for (unsigned byte = 0x20; byte < 0x80; ++byte) plain[byte] = byte != '"' && byte != '\\';
    return plain;
}();

constexpr auto kPlainInURL = [] {
    std::array<bool, 256> plain{};
    for (const char c : std::string_view("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._~/")) {
        plain[static_cast<std::uint8_t>(c)] = true;
    }
    return plain;
}();

/// Length of the beginning that needs no change.
std::size_t plainLength(std::string_view text, const std::array<bool, 256>& plain) {
    std::size_t length = 0;
    while (length < text.size() && plain[static_cast<std::uint8_t>(text[length])]) ++length;
    return length;
}

void appendEscaped(std::string& out, char c) {
    switch (c) {
        case '"': out += "\\\""; return;
        case '\\': out += "\\\\"; return;
        case '\b': out += "\\b"; return;
        case '\f': out += "\\f"; return;
        case '\n': out += "\\n"; return;
        case '\r': out += "\\r"; return;
        case '\t': out += "\\t"; return;
        default: break;
    }
    const auto byte = static_cast<std::uint8_t>(c);
    const char escape[6] = {'\\', 'u', '0', '0', kHexLower[byte >> 4], kHexLower[byte & 15]};
    out.append(escape, sizeof escape);
}

}  // namespace

void appendJsonString(std::string& out, std::string_view text) {
    out += '"';
    while (true) {
        const std::size_t plain = plainLength(text, kPlainInJson);
        out += text.substr(0, plain);
        text.remove_prefix(plain);
        if (text.empty()) break;

        const Utf8Step step = utf8Step(text);
        if (!step.isValid) {
            out += kReplacementCharacter;
        } else if (step.length == 1) {
            appendEscaped(out, text.front());
        } else {
            out += text.substr(0, step.length);
        }
        text.remove_prefix(step.length);
    }
    out += '"';
}

std::string jsonString(std::string_view text) {
    std::string out;
    appendJsonString(out, text);
    return out;
}

void appendJsonNumber(std::string& out, std::uint64_t value) {
    const fmt::format_int digits(value);
    out.append(digits.data(), digits.size());
}

void appendJsonNumber(std::string& out, std::int64_t value) {
    const fmt::format_int digits(value);
    out.append(digits.data(), digits.size());
}

void appendPercentEncoded(std::string& out, std::string_view path) {
    while (true) {
        const std::size_t plain = plainLength(path, kPlainInURL);
        out += path.substr(0, plain);
        if (plain == path.size()) return;
        const auto byte = static_cast<std::uint8_t>(path[plain]);
        const char escape[3] = {'%', kHexUpper[byte >> 4], kHexUpper[byte & 15]};
        out.append(escape, sizeof escape);
        path.remove_prefix(plain + 1);
    }
}

}  // namespace cindral
