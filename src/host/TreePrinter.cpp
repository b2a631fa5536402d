#include "host/TreePrinter.h"

#include <fmt/format.h>

#include <algorithm>

#include "host/HostError.h"
#include "host/ItemWriter.h"
#include "host/TerminalText.h"

namespace cindral {

TreePrinter::TreePrinter(ProviderAccess& client, const PresentedPaths& paths, const ItemText& text, TextOutput& output,
                         Options options)
    : client_(client), paths_(paths), text_(text), output_(output), options_(std::move(options)) {}

Result<void> TreePrinter::print(const TesselItemIdentifier& container) {
    auto top = std::make_unique<Level>(client_, container);
    TRY(advance(*top));
    if (options_.form == Form::drawing) output_.line(options_.title);
    levels_.push_back(std::move(top));
    while (!levels_.empty() && !output_.isBroken()) printNext();
    if (options_.form == Form::drawing) printCounts();
    return {};
}

Result<void> TreePrinter::advance(Level& level) {
    level.upcoming = nullptr;
    level.upcoming = TRY(level.listing.next());
    return {};
}

void TreePrinter::printNext() {
    Level& level = *levels_.back();
    indent_.resize(level.indentLength);
    const std::shared_ptr<const TesselItem> item = std::move(level.upcoming);
    if (item == nullptr) {
        levels_.pop_back();
        return;
    }
    const auto advanced = advance(level);
    const bool isLast = level.upcoming == nullptr;
    const ItemKind kind = kindOf(*item);
    count(kind);

    std::string remark;
    auto below = open(*item, kind, remark);
    if (!advanced.ok()) {
        // The rest of this folder can't be read; its last line says so.
        remark += fmt::format("  [what follows: {}]", messageOf(advanced.error()));
        note(*item, advanced.error());
    }
    printLine(*item, kind, isLast, remark);
    if (below != nullptr) {
        indent_ += isLast ? "    " : "│   ";
        below->indentLength = indent_.size();
        levels_.push_back(std::move(below));
    }
}

/// The level below an item, where there is one; null, with a remark for its line, where it can't be read.
std::unique_ptr<TreePrinter::Level> TreePrinter::open(const TesselItem& item, ItemKind kind, std::string& remark) {
    const bool descends = kind == ItemKind::folder || (kind == ItemKind::package && options_.intoPackages);
    // A folder can be mounted into itself.
    if (!descends || isOnTheWay(item.itemIdentifier())) return nullptr;
    auto level = std::make_unique<Level>(client_, item.itemIdentifier());
    if (auto advanced = advance(*level); !advanced.ok()) {
        remark = fmt::format("  [{}]", messageOf(advanced.error()));
        note(item, advanced.error());
        return nullptr;
    }
    return level;
}

bool TreePrinter::isOnTheWay(const TesselItemIdentifier& container) const {
    return std::ranges::any_of(levels_, [&](const auto& level) { return level->listing.container() == container; });
}

void TreePrinter::note(const TesselItem& item, const KsError& error) {
    if (unreadable_++ == 0) firstUnreadable_ = fmt::format("{}: {}", terminalText(item.filename()), messageOf(error));
}

void TreePrinter::printLine(const TesselItem& item, ItemKind kind, bool isLast, std::string_view remark) {
    std::string& out = output_.buffer();
    switch (options_.form) {
        case Form::json: ItemWriter(paths_).append(out, item); break;
        case Form::bareNames: appendBareName(out, item, paths_); break;
        case Form::drawing:
            out += indent_;
            out += isLast ? "└── " : "├── ";
            text_.appendName(out, item, kind);
            out += remark;
            break;
    }
    output_.endLine();
}

void TreePrinter::count(ItemKind kind) {
    switch (kind) {
        case ItemKind::folder: ++folders_; return;
        case ItemKind::package:
        case ItemKind::document: ++documents_; return;
        case ItemKind::link:
        case ItemKind::fifo:
        case ItemKind::socket:
        case ItemKind::characterDevice:
        case ItemKind::blockDevice: ++others_; return;
    }
}

void TreePrinter::printCounts() {
    std::string text = counted(folders_, "folder", "folders") + ", " + counted(documents_, "document", "documents");
    if (others_ > 0) text += ", " + counted(others_, "other item", "other items");
    output_.line("");
    output_.line(text);
}

Result<void> TreePrinter::unreadableFolders() const {
    if (unreadable_ == 0) return {};
    return hostFailure(fmt::format("{} could not be read, the first of them {}",
                                   counted(unreadable_, "folder", "folders"), firstUnreadable_));
}

}  // namespace cindral
