#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/KsDate.h"

namespace CLI {
class App;
}  // namespace CLI

namespace cindral {

enum class EditCommand {
    importFiles,
    mkdir,
    rename,
    mv,
    rm,
    trash,
    restore,
    emptyTrash,
    tag,
    untag,
    tags,
    favorite,
    unfavorite,
    touchUsed
};

/// What the words of a command say that changes something.
///
/// Thread safety: a value.
struct EditOptions {
    EditCommand command = EditCommand::tags;
    std::vector<std::string> words;     ///< in the order in which the command's help names them
    std::optional<std::string> folder;  ///< the item to put things into
    bool keepsBoth = false;             ///< a name that is taken makes it look for a free one
    bool isSure = false;                ///< nobody is asked
    std::string olderThan;              ///< an age or a date, as momentOf() reads it; empty: now
    std::string date;                   ///< the same
    bool isCleared = false;
    std::int64_t rank = 1;
};

/// Makes the commands known, each with its help. What they are given goes to `options`, which lives as long as the app.
void addEditCommands(CLI::App& app, EditOptions& options);
/// None for the name of another command.
std::optional<EditCommand> editCommandNamed(std::string_view name);

/// The moment that a text names: "30d" (also s, m, h, w) is that long before now, "2026-11-20" the beginning of the day
/// in UTC, all else a date of RFC 3339.
std::optional<KsDate> momentOf(std::string_view text, const KsDate& now);

}  // namespace cindral
