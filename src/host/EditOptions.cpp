#include "host/EditOptions.h"

#include <fmt/format.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <charconv>

namespace cindral {
namespace {

struct EditDescription {
    EditCommand command;
    const char* name;
    const char* description;
    const char* words;  ///< null for none
    int wordsMin;
    int wordsMax;
};

constexpr int kAnyNumber = 1 << 20;

constexpr EditDescription kEdits[] = {
    {EditCommand::importFiles, "import", "Copy files and folders from anywhere into the storage.", "FILE", 1,
     kAnyNumber},
    {EditCommand::mkdir, "mkdir", "Make folders.", "FOLDER", 1, kAnyNumber},
    {EditCommand::rename, "rename", "Give an item another name.", "ITEM NAME", 2, 2},
    {EditCommand::mv, "mv", "Move items into a folder, the last item named.", "ITEM", 2, kAnyNumber},
    {EditCommand::rm, "rm", "Delete items for good.", "ITEM", 1, kAnyNumber},
    {EditCommand::trash, "trash", "Move items to the trash; without items, show what is in it.", "ITEM", 0, kAnyNumber},
    {EditCommand::restore, "restore", "Take items out of the trash, back to where they were.", "ITEM", 1, kAnyNumber},
    {EditCommand::emptyTrash, "empty-trash", "Delete for good what is in the trash.", nullptr, 0, 0},
    {EditCommand::tag, "tag", "Put a tag on items.", "TAG ITEM", 2, kAnyNumber},
    {EditCommand::untag, "untag", "Take a tag off items.", "TAG ITEM", 2, kAnyNumber},
    {EditCommand::tags, "tags", "Print the tags of items, one a line; without items, all tags and how many bear them.",
     "ITEM", 0, kAnyNumber},
    {EditCommand::favorite, "favorite", "Make items favorites.", "ITEM", 1, kAnyNumber},
    {EditCommand::unfavorite, "unfavorite", "Make items favorites no longer.", "ITEM", 1, kAnyNumber},
    {EditCommand::touchUsed, "touch-used", "Note that items were used.", "ITEM", 1, kAnyNumber},
};

constexpr const char* kWordsHelp =
    "Items are named by identifier or by path; see ls --help. What begins with - goes after --.";
constexpr const char* kMomentHelp = "An age such as 30d (also s, m, h, w), a day, or a date of RFC 3339.";

void addOptionsOf(CLI::App& command, EditCommand edit, EditOptions& options) {
    const auto keepBoth = [&] {
        command.add_flag("--keep-both", options.keepsBoth, "Where the name is taken, take a free one beside it.");
    };
    const auto folder = [&](const char* name, const char* help) {
        command.add_option(name, options.folder, help)->type_name("ITEM");
    };
    const CLI::Validator isMoment(
        [](const std::string& text) { return momentOf(text, KsDate::now()) ? "" : "is no age and no date: " + text; },
        "", "moment");
    // The library takes numbers that are too large for the largest.
    const CLI::Validator isNumber(
        [](const std::string& text) {
            std::int64_t number = 0;
            const auto read = std::from_chars(text.data(), text.data() + text.size(), number);
            const bool isRead = read.ec == std::errc() && read.ptr == text.data() + text.size();
            return isRead ? "" : "is no number of 64 bits: " + text;
        },
        "", "number");
    switch (edit) {
        case EditCommand::importFiles:
            folder("--to", "The folder to copy into. Default: the storage itself.");
            keepBoth();
            return;
        case EditCommand::mkdir:
            folder("--in", "The folder to make them in; what is named then is a name, otherwise a path.");
            keepBoth();
            return;
        case EditCommand::rename:
        case EditCommand::mv: keepBoth(); return;
        case EditCommand::rm: command.add_flag("--yes", options.isSure, "Don't ask."); return;
        case EditCommand::restore: folder("--to", "The folder to put them into, instead of where they were."); return;
        case EditCommand::emptyTrash:
            command
                .add_option("--older-than", options.olderThan,
                            fmt::format("Only what was trashed before then. {}", kMomentHelp))
                ->type_name("WHEN")
                ->check(isMoment);
            command.add_flag("--yes", options.isSure, "Don't ask.");
            return;
        case EditCommand::favorite:
            command.add_option("--rank", options.rank, "Their place among the favorites. Default: 1.")
                ->type_name("NUMBER")
                ->check(isNumber);
            return;
        case EditCommand::touchUsed:
            command.add_option("--date", options.date, fmt::format("When. Default: now. {}", kMomentHelp))
                ->type_name("WHEN")
                ->check(isMoment);
            command.add_flag("--clear", options.isCleared, "Forget when they were used.");
            return;
        case EditCommand::trash:
        case EditCommand::tag:
        case EditCommand::untag:
        case EditCommand::tags:
        case EditCommand::unfavorite: return;
    }
}

}  // namespace

void addEditCommands(CLI::App& app, EditOptions& options) {
    for (const EditDescription& edit : kEdits) {
        CLI::App* command = app.add_subcommand(edit.name, edit.description);
        command->fallthrough();
        if (edit.words != nullptr) {
            command->add_option(edit.words, options.words, kWordsHelp)
                ->type_name("")
                ->required(edit.wordsMin > 0)
                ->expected(edit.wordsMin, edit.wordsMax);
        }
        addOptionsOf(*command, edit.command, options);
    }
}

std::optional<EditCommand> editCommandNamed(std::string_view name) {
    const auto* found = std::ranges::find(kEdits, name, &EditDescription::name);
    return found != std::end(kEdits) ? std::optional(found->command) : std::nullopt;
}

std::optional<KsDate> momentOf(std::string_view text, const KsDate& now) {
    constexpr std::pair<char, std::int64_t> kUnits[] = {
        {'s', 1}, {'m', 60}, {'h', 3'600}, {'d', 86'400}, {'w', 604'800}};
    // Longer ago than anybody means, and far from the ends of what seconds can count.
    constexpr std::int64_t kAgeMax = 1'000'000'000'000;
    std::int64_t count = 0;
    const auto read = std::from_chars(text.data(), text.data() + text.size(), count);
    if (read.ec == std::errc() && read.ptr + 1 == text.data() + text.size()) {
        const auto* unit = std::ranges::find(kUnits, *read.ptr, &std::pair<char, std::int64_t>::first);
        if (unit == std::end(kUnits) || count < 0 || count > kAgeMax / unit->second) return std::nullopt;
        return KsDate{now.seconds - count * unit->second, now.nanoseconds};
    }
    if (const auto day = KsDate::parseRFC3339(std::string(text) + "T00:00:00Z")) return day;
    return KsDate::parseRFC3339(text);
}

}  // namespace cindral
