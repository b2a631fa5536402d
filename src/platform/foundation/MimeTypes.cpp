#include "platform/foundation/MimeTypes.h"

#include <algorithm>

namespace cindral {

namespace {

constexpr std::string_view kOctetStream = "application/octet-stream";
constexpr std::string_view kPlainText = "text/plain";

bool conformsByNature(std::string_view name, std::string_view to) {
    if (name == to) return true;
    if (to == kPlainText) return name.starts_with("text/");
    // A declared type has no slash and stands for folders, which are no bytes.
    return to == kOctetStream && name.find('/') != std::string_view::npos && !name.starts_with("inode/");
}

/// Calls `use` with the two names of each line that is well formed.
template <typename Use>
void forEachPair(std::string_view text, Use use) {
    forEachLine(text, [&](std::string_view line) {
        const std::size_t space = line.find(' ');
        if (space == std::string_view::npos) return;
        const std::string_view first = line.substr(0, space);
        const std::string_view second = line.substr(space + 1);
        if (isMediaTypeName(first) && isMediaTypeName(second)) use(first, second);
    });
}

}  // namespace

bool isMediaTypeName(std::string_view text) {
    const std::size_t slash = text.find('/');
    if (slash == std::string_view::npos || slash == 0 || slash + 1 == text.size()) return false;
    if (text.find('/', slash + 1) != std::string_view::npos) return false;
    return std::ranges::all_of(text, [](char c) { return c > ' ' && c < '\x7f'; });
}

MimeType MimeTypes::add(std::string_view name) {
    if (const auto known = find(name)) return *known;
    const auto type = MimeType(entries_.size());
    const auto place = types_.emplace(name, type).first;
    entries_.push_back({&place->first, type, {}});
    return type;
}

std::optional<MimeType> MimeTypes::find(std::string_view name) const {
    const auto place = types_.find(name);
    if (place == types_.end()) return std::nullopt;
    return place->second;
}

void MimeTypes::addAliases(std::string_view text) {
    forEachPair(text, [this](std::string_view alias, std::string_view name) {
        const MimeType other = add(alias);
        const MimeType type = add(name);
        if (entry(other).canonical == other) entry(other).canonical = type;
    });
}

void MimeTypes::addSubclasses(std::string_view text) {
    forEachPair(text, [this](std::string_view name, std::string_view parent) { addParent(add(name), add(parent)); });
}

void MimeTypes::addParent(MimeType type, MimeType parent) {
    entry(type).parents.push_back(parent);
}

bool MimeTypes::conforms(std::string_view type, std::string_view to) const {
    const auto target = find(to);
    if (target) to = name(canonical(*target));
    const auto start = find(type);
    if (!start) return conformsByNature(type, to);
    const MimeType from = canonical(*start);
    if (conformsByNature(name(from), to)) return true;
    // Most types have no parents, and a name that nothing mentions is nobody's parent.
    return target && !entry(from).parents.empty() && walkConforms(from, to);
}

bool MimeTypes::walkConforms(MimeType from, std::string_view to) const {
    // Files of several origins can make a circle: each type is looked at once.
    std::vector<bool> seen(size());
    std::vector<MimeType> open{from};
    seen[static_cast<std::size_t>(from)] = true;
    while (!open.empty()) {
        const MimeType type = open.back();
        open.pop_back();
        if (conformsByNature(name(type), to)) return true;
        for (const MimeType named : entry(type).parents) {
            const MimeType parent = canonical(named);
            if (seen[static_cast<std::size_t>(parent)]) continue;
            seen[static_cast<std::size_t>(parent)] = true;
            open.push_back(parent);
        }
    }
    return false;
}

}  // namespace cindral
