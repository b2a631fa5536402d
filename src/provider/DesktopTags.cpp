#include "provider/DesktopTags.h"

#include <algorithm>

#include "platform/foundation/Utf8.h"

namespace cindral::desktop_tags {

namespace {

std::string_view trimmed(std::string_view text) {
    constexpr std::string_view kBlank = " \t\r\n";
    const std::size_t begin = text.find_first_not_of(kBlank);
    if (begin == std::string_view::npos) return {};
    return text.substr(begin, text.find_last_not_of(kBlank) + 1 - begin);
}

}  // namespace

std::optional<std::vector<std::string>> decode(ByteView bytes) {
    std::string_view text = textOf(bytes);
    // Some end it as a string of C ends.
    text = text.substr(0, text.find('\0'));
    std::vector<std::string> labels;
    while (!text.empty()) {
        const std::size_t end = std::min(text.find(','), text.size());
        const std::string_view label = trimmed(text.substr(0, end));
        if (!label.empty() && isUtf8(label) && std::ranges::find(labels, label) == labels.end())
            labels.emplace_back(label);
        text.remove_prefix(std::min(end + 1, text.size()));
    }
    return labels.empty() ? std::nullopt : std::optional(std::move(labels));
}

std::optional<Bytes> encode(const std::vector<std::string>& labels) {
    std::string text;
    for (const std::string& label : labels) {
        const auto read = label.find(',') == std::string::npos ? decode(bytesOf(label)) : std::nullopt;
        if (!read || read->front() != label) continue;
        if (!text.empty()) text += ',';
        text += label;
    }
    if (text.empty()) return std::nullopt;
    const ByteView bytes = bytesOf(text);
    return Bytes(bytes.begin(), bytes.end());
}

}  // namespace cindral::desktop_tags
