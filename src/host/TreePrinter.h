#pragma once

#include <memory>
#include <string>
#include <vector>

#include "host/ContainerListing.h"
#include "host/ItemText.h"
#include "host/PresentedPaths.h"
#include "host/TextOutput.h"

namespace cindral {

/// Prints a folder and what is below it, depth first, while it is read.
///
/// One page of each folder on the way down is in memory at a time. Links are shown, never followed. A folder that can't
/// be read is marked so, and the rest goes on.
///
/// Thread safety: for one thread at a time.
class TreePrinter {
public:
    /// All but the drawing are one item a line, without counts.
    enum class Form { drawing, json, bareNames };
    struct Options {
        Form form = Form::drawing;
        bool intoPackages = false;
        std::string title;  ///< the first line, escaped
    };

    /// All borrowed for life.
    TreePrinter(ProviderAccess& client, const PresentedPaths& paths, const ItemText& text, TextOutput& output,
                Options options);

    /// Errors of the container itself, as the provider says them.
    Result<void> print(const TesselItemIdentifier& container);
    /// A failure, with a line for people, where there was a folder that could not be read.
    Result<void> unreadableFolders() const;

private:
    struct Level {
        Level(ProviderAccess& client, const TesselItemIdentifier& container) : listing(client, container) {}
        ContainerListing listing;
        std::shared_ptr<const TesselItem>
            upcoming;                  ///< null: nothing left; drawn differently, so it is known one ahead
        std::size_t indentLength = 0;  ///< of the text before the level's branches
    };

    Result<void> advance(Level& level);
    void printNext();
    void printLine(const TesselItem& item, ItemKind kind, bool isLast, std::string_view remark);
    void count(ItemKind kind);
    void printCounts();
    bool isOnTheWay(const TesselItemIdentifier& container) const;
    std::unique_ptr<Level> open(const TesselItem& item, ItemKind kind, std::string& remark);
    void note(const TesselItem& item, const KsError& error);

    ProviderAccess& client_;
    const PresentedPaths& paths_;
    const ItemText& text_;
    TextOutput& output_;
    const Options options_;

    std::vector<std::unique_ptr<Level>> levels_;
    std::string indent_;
    std::uint64_t folders_ = 0;
    std::uint64_t documents_ = 0;
    std::uint64_t others_ = 0;
    std::uint64_t unreadable_ = 0;
    std::string firstUnreadable_;
};

}  // namespace cindral
