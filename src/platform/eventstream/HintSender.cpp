#include "platform/eventstream/HintSender.h"

#include <charconv>
#include <optional>

namespace cindral {

namespace {

std::optional<FileID> objectOfAnonymousName(std::string_view name) {
    if (name.size() < 2 || name.front() != '#') return std::nullopt;
    std::uint64_t number = 0;
    const char* const end = name.data() + name.size();
    const auto [at, error] = std::from_chars(name.data() + 1, end, number);
    if (error != std::errc() || at != end) return std::nullopt;
    return FileID{number};
}

}  // namespace

void HintSender::entry(FileID folder, std::string_view name) {
    send({.kind = EventHint::Kind::entry, .folder = folder, .name = name});
    if (const auto fileID = objectOfAnonymousName(name)) object(*fileID);
}

void HintSender::send(const EventHint& hint) {
    if (hasPrevious_ && hint.kind == previous_.kind && hint.folder == previous_.folder &&
        hint.fileID == previous_.fileID && hint.name == previous_.name)
        return;
    previous_ = hint;
    hasPrevious_ = true;
    receive_(hint);
}

}  // namespace cindral
