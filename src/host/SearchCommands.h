#pragma once

#include "host/Commands.h"

namespace cindral {

/// The commands that look across folders: find, recents, tagged, favorites, the list of the trash and that of all tags.
///
/// Errors are the host's own, with a line for people.
///
/// Thread safety: for one thread at a time.
class SearchCommands {
public:
    /// All borrowed for life.
    SearchCommands(const Commands::Context& context, TextOutput& output);

    /// Prints what the query answers, as much as the options allow.
    Result<void> find(const SearchQuery& query);
    Result<void> allTags();

private:
    void printItem(const TesselItem& item);

    const Commands::Context& context_;
    TextOutput& output_;
    const ItemText text_;
};

}  // namespace cindral
