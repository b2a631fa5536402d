#include "platform/foundation/KeyedArchive.h"

#include <cmath>
#include <utility>

namespace cindral::keyed_archive {

namespace {

// Written to disk: never change one. What an archive says of itself changes with the number of its version alone.
constexpr const char* kArchiverKey = "archiver";
constexpr const char* kArchiver = "KsKeyedArchiver";
constexpr const char* kVersionKey = "version";
constexpr std::uint64_t kVersion = 1;
constexpr const char* kRootKey = "root";

bool isArchive(const PropertyList::Dictionary& top) {
    const auto archiver = top.find(kArchiverKey);
    const auto version = top.find(kVersionKey);
    return top.size() == (top.contains(kRootKey) ? 3 : 2) && archiver != top.end() &&
           archiver->second == PropertyList(kArchiver) && version != top.end() &&
           version->second == PropertyList(kVersion);
}

std::optional<std::int64_t> integerFrom(double real) {
    // 2^63 itself does not fit. Not a number fails every comparison.
    if (!(real >= -0x1p63 && real < 0x1p63) || real != std::trunc(real)) return std::nullopt;
    return static_cast<std::int64_t>(real);
}

}  // namespace

Bytes archive(const PropertyList& root) {
    return PropertyList(PropertyList::Dictionary{{kArchiverKey, kArchiver}, {kVersionKey, kVersion}, {kRootKey, root}})
        .encodeBinary();
}

std::optional<Unarchived> unarchive(ByteView bytes) {
    const Result<PropertyList> list = PropertyList::decodeBinary(bytes);
    if (!list || !list->dictionary() || !isArchive(*list->dictionary())) return std::nullopt;
    const PropertyList* root = list->find(kRootKey);
    return Unarchived{root == nullptr ? std::nullopt : std::optional(*root)};
}

std::optional<PropertyList> unarchiveRoot(ByteView bytes) {
    std::optional<Unarchived> archive = unarchive(bytes);
    return archive ? std::move(archive->root) : std::nullopt;
}

std::optional<KsDate> unarchiveDate(ByteView bytes) {
    const std::optional<PropertyList> root = unarchiveRoot(bytes);
    if (!root || !root->date()) return std::nullopt;
    return *root->date();
}

std::optional<std::string> unarchiveString(ByteView bytes) {
    const std::optional<PropertyList> root = unarchiveRoot(bytes);
    if (!root || !root->string()) return std::nullopt;
    return *root->string();
}

std::optional<std::vector<std::string>> unarchiveStrings(ByteView bytes) {
    const std::optional<PropertyList> root = unarchiveRoot(bytes);
    if (!root || !root->array()) return std::nullopt;
    std::vector<std::string> strings;
    strings.reserve(root->array()->size());
    for (const PropertyList& element : *root->array()) {
        if (!element.string()) return std::nullopt;
        strings.push_back(*element.string());
    }
    return strings;
}

std::optional<std::int64_t> unarchiveInteger(ByteView bytes) {
    const std::optional<PropertyList> root = unarchiveRoot(bytes);
    if (!root) return std::nullopt;
    if (const auto* negative = root->negativeInteger()) return *negative;
    if (const auto* real = root->real()) return integerFrom(*real);
    const auto* number = root->unsignedInteger();
    if (!number || !std::in_range<std::int64_t>(*number)) return std::nullopt;
    return static_cast<std::int64_t>(*number);
}

}  // namespace cindral::keyed_archive
