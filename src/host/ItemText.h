#pragma once

#include <string>
#include <string_view>

#include "host/PresentedPaths.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// What an item is, for people.
enum class ItemKind { folder, package, document, link, fifo, socket, characterDevice, blockDevice };
ItemKind kindOf(const TesselItem& item);

/// Whether the item is listed by what is in it: folders, app libraries and packages.
bool isContainer(ItemKind kind);

/// How programs are told of an item: its path as it is, its identifier where it has none. Either names it to a command.
void appendBareName(std::string& out, const TesselItem& item, const PresentedPaths& paths);

/// Items in the words of the command line.
///
/// Thread safety: immutable.
class ItemText {
public:
    explicit ItemText(bool wantsColor) : wantsColor_(wantsColor) {}

    /// The name, escaped, in the colour of its kind.
    void appendName(std::string& out, const TesselItem& item, ItemKind kind) const {
        appendName(out, item.filename(), kind);
    }
    void appendName(std::string& out, std::string_view name, ItemKind kind) const;
    /// "drwmntd      3 items  2026-11-20 09:52  Projects"
    void appendLine(std::string& out, const TesselItem& item) const { appendLine(out, item, item.filename()); }
    /// The same with another text for the name.
    void appendLine(std::string& out, const TesselItem& item, std::string_view name) const;
    /// Every field that has a value, one a line.
    std::string allFields(const TesselItem& item, const std::string& realURL) const;

private:
    bool wantsColor_;
};

}  // namespace cindral
