#include "host/http/HttpRequest.h"

#include <algorithm>

namespace cindral {
namespace {

std::optional<int> hexDigit(char digit) {
    if (digit >= '0' && digit <= '9') return digit - '0';
    if (digit >= 'a' && digit <= 'f') return digit - 'a' + 10;
    if (digit >= 'A' && digit <= 'F') return digit - 'A' + 10;
    return std::nullopt;
}

/// Calls back with each part between separators.
template <typename Each>
void split(std::string_view text, char separator, const Each& each) {
    while (!text.empty()) {
        const std::size_t end = text.find(separator);
        each(text.substr(0, end));
        if (end == std::string_view::npos) return;
        text.remove_prefix(end + 1);
    }
}

}  // namespace

std::optional<std::string> percentDecode(std::string_view text) {
    std::string decoded;
    decoded.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            decoded += text[i];
            continue;
        }
        if (text.size() - i < 3) return std::nullopt;
        const auto high = hexDigit(text[i + 1]);
        const auto low = hexDigit(text[i + 2]);
        if (!high || !low) return std::nullopt;
        decoded += static_cast<char>(*high * 16 + *low);
        i += 2;
    }
    return decoded;
}

std::size_t HttpRequest::count(std::string_view name) const {
    return static_cast<std::size_t>(
        std::ranges::count_if(fields, [&](const auto& field) { return field.first == name; }));
}

std::optional<std::string_view> HttpRequest::only(std::string_view name) const {
    std::optional<std::string_view> found;
    for (const auto& [each, value] : fields) {
        if (each != name) continue;
        if (found) return std::nullopt;
        found = value;
    }
    return found;
}

std::optional<std::string> HttpRequest::parameter(std::string_view name) const {
    std::optional<std::string_view> found;
    std::size_t times = 0;
    split(query, '&', [&](std::string_view part) {
        const std::size_t equals = std::min(part.find('='), part.size());
        if (part.substr(0, equals) != name) return;
        ++times;
        found = part.substr(std::min(equals + 1, part.size()));
    });
    return times == 1 ? percentDecode(*found) : std::nullopt;
}

std::vector<std::string_view> HttpRequest::cookies(std::string_view name) const {
    std::vector<std::string_view> values;
    for (const auto& [field, value] : fields) {
        if (field != "cookie") continue;
        split(value, ';', [&](std::string_view part) {
            part.remove_prefix(std::min(part.find_first_not_of(' '), part.size()));
            const std::size_t equals = part.find('=');
            if (equals != std::string_view::npos && part.substr(0, equals) == name)
                values.push_back(part.substr(equals + 1));
        });
    }
    return values;
}

}  // namespace cindral
