#include "platform/eventstream/RootPaths.h"

#include <fmt/format.h>

#include <charconv>
#include <string_view>

namespace cindral {
namespace {

// What the store takes at once.
constexpr std::size_t kBytesMax = 65'536;

}  // namespace

Bytes encodeRootPaths(const RootPaths& current, const RootPaths& former) {
    std::string text;
    for (const RootPaths* paths : {&current, &former}) {
        for (const auto& [fileID, path] : *paths) {
            const std::string entry = fmt::format("{} {}", static_cast<std::uint64_t>(fileID), path);
            if (text.size() + entry.size() + 1 <= kBytesMax) text.append(entry).push_back('\0');
        }
    }
    const ByteView bytes = std::as_bytes(std::span(text));
    return {bytes.begin(), bytes.end()};
}

RootPaths decodeRootPaths(ByteView bytes) {
    RootPaths paths;
    std::string_view rest(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    for (auto end = rest.find('\0'); end != std::string_view::npos; end = rest.find('\0')) {
        const std::string_view entry = rest.substr(0, end);
        rest.remove_prefix(end + 1);
        std::uint64_t fileID = 0;
        const auto [stop, error] = std::from_chars(entry.data(), entry.data() + entry.size(), fileID);
        const auto path = entry.substr(static_cast<std::size_t>(stop - entry.data()));
        if (error == std::errc() && path.starts_with(" /")) paths.insert_or_assign(FileID{fileID}, path.substr(1));
    }
    return paths;
}

}  // namespace cindral
