#include "platform/tessel/FreeName.h"

#include <fmt/format.h>

namespace cindral {

namespace {

// What follows the last "." of a longer name is no extension that anybody typed.
constexpr std::size_t kExtensionBytesMax = 32;

/// With its "."; empty for none.
std::string_view extensionOf(std::string_view name, NameKind kind) {
    if (kind == NameKind::folder) return {};
    const std::size_t dot = name.rfind('.');
    const bool isOnlyFirst = dot == 0 || name.find_first_not_of('.') > dot;
    if (dot == std::string_view::npos || isOnlyFirst || name.size() - dot > kExtensionBytesMax) return {};
    return name.substr(dot);
}

/// The longest beginning of at most that many bytes that ends between two characters.
std::string_view cut(std::string_view text, std::size_t bytesMax) {
    if (text.size() <= bytesMax) return text;
    std::size_t end = bytesMax;
    const auto isContinuation = [&] { return (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80; };
    while (end > 0 && bytesMax - end < 3 && isContinuation()) --end;
    // Four in a row are no UTF-8: then any place is as good.
    return text.substr(0, isContinuation() ? bytesMax : end);
}

}  // namespace

std::string alternativeName(std::string_view name, NameKind kind, std::uint64_t number) {
    const std::string_view extension = extensionOf(name, kind);
    const std::string suffix = fmt::format(" {}{}", number, extension);
    const std::string_view stem = name.substr(0, name.size() - extension.size());
    return std::string(cut(stem, kNameBytesMax - suffix.size())) + suffix;
}

}  // namespace cindral
