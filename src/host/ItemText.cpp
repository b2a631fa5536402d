#include "host/ItemText.h"

#include <fmt/format.h>

#include "host/TerminalText.h"
#include "platform/foundation/Base64.h"
#include "platform/foundation/TypeDatabase.h"

namespace cindral {
namespace {

constexpr std::string_view kNoColor = "\x1b[0m";

struct Capability {
    TesselItemCapabilities bit;
    char letter;
    std::string_view word;
};

constexpr Capability kCapabilities[] = {
    {TesselItemCapabilities::allowsReading, 'r', "read"},     {TesselItemCapabilities::allowsWriting, 'w', "write"},
    {TesselItemCapabilities::allowsReparenting, 'm', "move"}, {TesselItemCapabilities::allowsRenaming, 'n', "rename"},
    {TesselItemCapabilities::allowsTrashing, 't', "trash"},   {TesselItemCapabilities::allowsDeleting, 'd', "delete"},
};

char letterOf(ItemKind kind) {
    switch (kind) {
        case ItemKind::folder: return 'd';
        case ItemKind::package: return 'p';
        case ItemKind::document: return '-';
        case ItemKind::link: return 'l';
        case ItemKind::fifo: return 'f';
        case ItemKind::socket: return 's';
        case ItemKind::characterDevice: return 'c';
        case ItemKind::blockDevice: return 'b';
    }
    return '-';
}

std::string_view colorOf(ItemKind kind) {
    switch (kind) {
        case ItemKind::folder: return "\x1b[1;34m";
        case ItemKind::package: return "\x1b[1;35m";
        case ItemKind::document: return "";
        case ItemKind::link: return "\x1b[36m";
        case ItemKind::fifo:
        case ItemKind::socket:
        case ItemKind::characterDevice:
        case ItemKind::blockDevice: return "\x1b[33m";
    }
    return "";
}

std::string sizeText(const TesselItem& item) {
    if (const auto children = item.childItemCount(); children && !item.documentSize()) {
        return *children == 1 ? "1 item" : fmt::format("{} items", *children);
    }
    const auto size = item.documentSize();
    return size ? humanSize(*size) : "";
}

std::string capabilityWords(TesselItemCapabilities capabilities) {
    std::string words;
    for (const Capability& each : kCapabilities) {
        if (!(capabilities & each.bit)) continue;
        if (!words.empty()) words += ", ";
        words += each.word;
    }
    return words.empty() ? "none" : words;
}

/// Lines of a name, padded, and a value.
class Fields {
public:
    void add(std::string_view name, std::string_view value) {
        fmt::format_to(std::back_inserter(text_), "{:<24} {}\n", name, terminalText(value));
    }
    template <typename T, typename Format>
    void addOptional(std::string_view name, const std::optional<T>& value, Format format) {
        if (value) add(name, format(*value));
    }
    std::string take() { return std::move(text_); }

private:
    std::string text_;
};

std::string exactSize(std::uint64_t bytes) {
    return bytes < 1000 ? fmt::format("{} B", bytes) : fmt::format("{} B ({})", bytes, humanSize(bytes));
}

}  // namespace

ItemKind kindOf(const TesselItem& item) {
    const std::string& type = item.typeIdentifier();
    if (item.isAppLibrary() || type == "inode/directory") return ItemKind::folder;
    if (type == "inode/symlink") return ItemKind::link;
    if (type == "inode/fifo") return ItemKind::fifo;
    if (type == "inode/socket") return ItemKind::socket;
    if (type == "inode/chardevice") return ItemKind::characterDevice;
    if (type == "inode/blockdevice") return ItemKind::blockDevice;
    // Types that are declared by extension have reverse-DNS names, and the package types are among them.
    const bool isDeclared = type.find('/') == std::string::npos;
    return isDeclared && TypeDatabase::shared().conforms(type, kPackageTypeIdentifier) ? ItemKind::package
                                                                                       : ItemKind::document;
}

bool isContainer(ItemKind kind) {
    return kind == ItemKind::folder || kind == ItemKind::package;
}

void appendBareName(std::string& out, const TesselItem& item, const PresentedPaths& paths) {
    const KsURL* url = item.fileURL();
    out += url != nullptr ? paths.realPath(url->path()) : item.itemIdentifier();
}

void ItemText::appendName(std::string& out, std::string_view name, ItemKind kind) const {
    const std::string_view color = wantsColor_ ? colorOf(kind) : std::string_view();
    out += color;
    appendTerminalText(out, name);
    if (!color.empty()) out += kNoColor;
}

void ItemText::appendLine(std::string& out, const TesselItem& item, std::string_view name) const {
    const ItemKind kind = kindOf(item);
    out += letterOf(kind);
    for (const Capability& each : kCapabilities) out += item.capabilities() & each.bit ? each.letter : '-';
    const auto date = item.contentModificationDate();
    fmt::format_to(std::back_inserter(out), " {:>12}  {:<16}  ", sizeText(item), date ? humanMinute(*date) : "");
    appendName(out, name, kind);
}

std::string ItemText::allFields(const TesselItem& item, const std::string& realURL) const {
    const auto number = [](auto value) { return fmt::to_string(value); };
    const auto yesNo = [](bool value) { return value ? "yes" : "no"; };
    Fields fields;
    fields.add("identifier", item.itemIdentifier());
    fields.add("parentIdentifier", item.parentItemIdentifier());
    fields.add("filename", item.filename());
    fields.add("typeIdentifier", item.typeIdentifier());
    fields.add("capabilities", fmt::format("{} ({})", static_cast<std::uint32_t>(item.capabilities()),
                                           capabilityWords(item.capabilities())));
    fields.add("isTrashed", yesNo(item.isTrashed()));
    fields.add("isUbiquitous", yesNo(item.isUbiquitous()));
    if (item.isAppLibrary()) fields.add("isAppLibrary", "yes");
    fields.addOptional("documentSize", item.documentSize(), exactSize);
    fields.addOptional("creationDate", item.creationDate(), humanMoment);
    fields.addOptional("contentModificationDate", item.contentModificationDate(), humanMoment);
    fields.addOptional("childItemCount", item.childItemCount(), number);
    fields.addOptional("versionIdentifier", item.versionIdentifier(), base64Encode);
    fields.addOptional("lastUsedDate", item.lastUsedDate(), humanMoment);
    fields.addOptional("tags", item.tags(),
                       [](const std::vector<std::string>& tags) { return fmt::format("{}", fmt::join(tags, ", ")); });
    fields.addOptional("favoriteRank", item.favoriteRank(), number);
    fields.addOptional("fileID", item.fileID(), number);
    fields.addOptional("docID", item.docID(), number);
    if (!realURL.empty()) fields.add("fileURL", realURL);
    if (const std::string* bundle = item.appContainerBundleIdentifier()) fields.add("bundleIdentifier", *bundle);
    return fields.take();
}

}  // namespace cindral
