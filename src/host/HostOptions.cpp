#include "host/HostOptions.h"

#include <fmt/format.h>

#include <CLI/CLI.hpp>
#include <algorithm>

#include "host/HostError.h"
#include "host/HostVersion.h"
#include "host/PresentedPaths.h"
#include "host/ShellTexts.h"
#include "host/TerminalText.h"

namespace cindral {
namespace {

constexpr const char* kItemHelp =
    "An identifier (did=NUMBER, fid=NUMBER, #APPLICATION, or a container's well-known name), or a path. "
    "./did=1 is the file of that name. Without it: the root container.";

constexpr const char* kColumnsHelp =
    "The columns of a listing:\n"
    "  kind   d folder, - document, p package, l link, f FIFO, s socket, c and b devices\n"
    "  mark   what may be done with it: r read, w write, m move, n rename, t trash, d delete\n"
    "  size   or the number of items in a folder\n"
    "  date   of the last change, in local time\n"
    "  name   with control characters, and what is not UTF-8, as \\xNN";

/// The words as they stand, before what they mean is worked out.
struct Words {
    std::string storage;
    std::string state;
    std::vector<std::string> applications;
    std::string recorder = "auto";
    bool noFlatpak = false;
    bool desktopTags = false;
    bool json = false;
    bool endsWithNul = false;
    bool intoPackages = false;
    std::string since;
    std::string outputFile;
    std::string text;
    std::uint64_t limit = UINT64_MAX;
    std::string item;
    bool http = false;
    std::uint16_t httpPort = 0;
    std::uint64_t uploadBytesMax = HostOptions{}.uploadBytesMax;
    EditOptions edit;
};

enum class Argument { none, optionalItem, item, path, application, text, tag };

struct CommandDescription {
    const char* name;
    const char* description;
    HostCommand command;
    Argument argument;
};

constexpr CommandDescription kCommands[] = {
    {"ls", "List what a folder holds, a page at a time.", HostCommand::ls, Argument::optionalItem},
    {"tree", "Show what a folder holds, and what is below it, as a tree, a page at a time.", HostCommand::tree,
     Argument::optionalItem},
    {"info", "Show all that is known of an item.", HostCommand::info, Argument::item},
    {"url", "Print the URL of an item.", HostCommand::url, Argument::item},
    {"id", "Print the identifier of the item at a path.", HostCommand::id, Argument::path},
    {"anchor", "Print the current sync anchor of a container, in base64.", HostCommand::anchor, Argument::optionalItem},
    {"changes", "Print what has changed in a container since an anchor, and the anchor that follows.",
     HostCommand::changes, Argument::optionalItem},
    {"watch", "Print what changes in a container, a line each, until it is interrupted.", HostCommand::watch,
     Argument::optionalItem},
    {"thumbnail", "Write the thumbnail of an item into a file, as PNG.", HostCommand::thumbnail, Argument::item},
    {"find", "Find items by their names: by how they begin, how a word in them begins, or any part of them.",
     HostCommand::find, Argument::text},
    {"recents", "Show documents, those first that were used or changed last.", HostCommand::recents, Argument::none},
    {"tagged", "Show the items that bear a tag.", HostCommand::tagged, Argument::tag},
    {"favorites", "Show the favorites, by their rank.", HostCommand::favorites, Argument::none},
    {"apps", "Show which applications are installed, and whose documents are published.", HostCommand::apps,
     Argument::none},
    {"status", "Show whether all is well, where the host works and what it knows.", HostCommand::status,
     Argument::none},
    {"doctor", "Compare all that is kept with what there is, repair what differs, and say what was done.",
     HostCommand::doctor, Argument::none},
    {"rpc", "Speak JSON-RPC 2.0 on standard input and output, one message a line.", HostCommand::rpc, Argument::none},
    {"serve",
     "Be the daemon of the state folder: the other commands, and all who speak JSON-RPC, find it by its socket.",
     HostCommand::serve, Argument::none},
    {"link", "Have the daemon let one browser of this machine in, and print the link.", HostCommand::link,
     Argument::none},
};

/// Words after "apps".
constexpr CommandDescription kAppsCommands[] = {
    {"enable", "Publish an application's documents, whatever its keys say; makes its Documents folder.",
     HostCommand::appsEnable, Argument::application},
    {"disable", "Don't publish an application's documents.", HostCommand::appsDisable, Argument::application},
};

/// What commands are for, in the order in which they are shown.
struct CommandGroup {
    const char* name;
    std::vector<std::string_view> commands;
};
constexpr const char* kOtherCommands = "More";

const std::vector<CommandGroup>& commandGroups() {
    static const std::vector<CommandGroup> kGroups = {
        {"Look", {"ls", "tree", "info", "url", "id", "tags", "thumbnail", "apps"}},
        {"Search", {"find", "recents", "tagged", "favorites"}},
        {"Follow", {"anchor", "changes", "watch"}},
        {"Edit", {"import", "mkdir", "rename", "mv", "rm"}},
        {"Throw away", {"trash", "restore", "empty-trash"}},
        {"Label", {"tag", "untag", "favorite", "unfavorite", "touch-used"}},
        {"Connect", {"status", "doctor", "serve", "link", "rpc"}},
    };
    return kGroups;
}

std::string groupOf(const std::string& command) {
    for (const CommandGroup& group : commandGroups()) {
        if (std::ranges::find(group.commands, command) != group.commands.end()) return group.name;
    }
    return kOtherCommands;
}

/// Those whose output is a list of items or names.
constexpr const char* kListCommands[] = {"ls",     "tree",      "url",   "id",   "find", "recents",
                                         "tagged", "favorites", "trash", "tags", "apps"};

RecorderChoice recorderOf(const std::string& name) {
    if (name == "inotify") return RecorderChoice::inotify;
    return name == "fanotify" ? RecorderChoice::fanotify : RecorderChoice::automatic;
}

std::string absolutePath(const std::string& path, const HostEnvironment& environment) {
    // In a folder that was removed, a relative path names nothing.
    if (path.empty() || (path.front() != '/' && environment.workingFolder.empty())) return {};
    return tidyPath(path.front() == '/' ? path : environment.workingFolder + "/" + path);
}

void addOptions(CLI::App& app, Words& words) {
    const CLI::Validator notEmpty([](const std::string& value) { return value.empty() ? "is empty" : ""; }, "",
                                  "not empty");
    app.add_option("--storage", words.storage,
                   "The document storage directory, made when missing. Default: your documents folder.")
        ->type_name("DIR")
        ->check(notEmpty);
    app.add_option("--state", words.state,
                   "Where the host keeps what it knows; not inside the storage. Default: $XDG_STATE_HOME/cindral.")
        ->type_name("DIR")
        ->check(notEmpty);
    app.add_option("--apps", words.applications,
                   "A folder of desktop entries, each an installed application. May be given again.")
        ->type_name("DIR")
        ->check(notEmpty)
        ->expected(1)
        ->take_all();
    app.add_flag("--no-flatpak", words.noFlatpak, "Leave Flatpak's applications out.");
    app.add_flag("--desktop-tags", words.desktopTags, "Share tags with file managers that keep them in user.xdg.tags.");
    app.add_option("--recorder", words.recorder, "How events are recorded: inotify, fanotify or auto (default).")
        ->type_name("HOW")
        ->check(CLI::IsMember({"inotify", "fanotify", "auto"}));
    app.add_flag("--json", words.json, "Write JSON to standard output, one value a line for lists.");
}

void addArgument(CLI::App& command, Argument argument, Words& words) {
    switch (argument) {
        case Argument::none: return;
        case Argument::optionalItem: command.add_option("ITEM", words.item, kItemHelp)->type_name(""); return;
        case Argument::item: command.add_option("ITEM", words.item, kItemHelp)->type_name("")->required(); return;
        case Argument::path:
            command.add_option("PATH", words.item, "A path, absolute or relative.")->type_name("")->required();
            return;
        case Argument::application:
            command.add_option("ID", words.item, "The application's identifier, as apps shows it.")
                ->type_name("")
                ->required();
            return;
        case Argument::text:
            command
                .add_option(
                    "TEXT", words.text,
                    "A part of the name. Case and accents make no difference. What begins with - goes after --.")
                ->type_name("")
                ->required();
            return;
        case Argument::tag: command.add_option("TAG", words.text, "The tag.")->type_name("")->required(); return;
    }
}

bool isSearch(HostCommand command) {
    return command == HostCommand::find || command == HostCommand::recents || command == HostCommand::tagged ||
           command == HostCommand::favorites;
}

void addHttpOptions(CLI::App& command, Words& words) {
    command.add_flag("--http", words.http,
                     "Serve the document browser to the browsers of this machine too; prints a link that lets one in.");
    command.add_option("--http-port", words.httpPort, "Its port; without it, or 0, any that is free. Means --http.")
        ->type_name("PORT");
    command
        .add_option("--http-upload-max", words.uploadBytesMax,
                    "Bytes of a document that a browser may send. Default: 64 GiB.")
        ->type_name("BYTES");
}

void addCommands(CLI::App& app, Words& words) {
    for (const CommandDescription& description : kCommands) {
        CLI::App* command = app.add_subcommand(description.name, description.description);
        command->fallthrough();
        addArgument(*command, description.argument, words);
        if (description.command == HostCommand::ls) command->footer(kColumnsHelp);
        if (isSearch(description.command)) {
            command->add_option("--limit", words.limit, "Print so many at most. Default: all.")
                ->type_name("NUMBER")
                ->check(CLI::PositiveNumber);
        }
        if (description.command == HostCommand::tree) {
            command->add_flag("--packages", words.intoPackages, "Also show what is in packages.");
        }
        if (description.command == HostCommand::changes) {
            command->add_option("--since", words.since, "The anchor, in base64.")->type_name("ANCHOR")->required();
        }
        if (description.command == HostCommand::thumbnail) {
            command->add_option("-o,--output", words.outputFile, "Where to write; \"-\" is standard output.")
                ->type_name("FILE")
                ->required();
        }
        if (description.command == HostCommand::serve) addHttpOptions(*command, words);
        if (description.command == HostCommand::apps) {
            for (const CommandDescription& each : kAppsCommands) {
                CLI::App* inner = command->add_subcommand(each.name, each.description);
                inner->fallthrough();
                addArgument(*inner, each.argument, words);
            }
            command->require_subcommand(0, 1);
        }
    }
}

/// The library takes what a callback throws for what is to be said instead of working.
void addShellTexts(CLI::App& app) {
    const auto say = [](const std::string& text) { throw CLI::CallForVersion(text, kExitDone); };
    // They are for who builds and packs the program, not for its manual.
    app.add_flag_callback("--manual", [&app, say] { say(manualText(app, std::string(hostVersion()))); })->group("");
    app.add_option_function<std::string>("--completion",
                                         [&app, say](const std::string& shell) { say(completionText(app, shell)); })
        ->check(CLI::IsMember(std::vector<std::string>(std::begin(kCompletionShells), std::end(kCompletionShells))))
        ->group("");
}

/// The innermost command that was named.
const CLI::App& chosenApp(const CLI::App& app) {
    const CLI::App* chosen = app.get_subcommands().front();
    const auto inner = chosen->get_subcommands();
    return inner.empty() ? *chosen : *inner.front();
}

/// None for a command that changes something.
const CommandDescription* chosenCommand(const CLI::App& app) {
    const CLI::App& chosen = chosenApp(app);
    const std::span<const CommandDescription> commands =
        chosen.get_parent() == &app ? std::span<const CommandDescription>(kCommands) : kAppsCommands;
    const auto found =
        std::ranges::find_if(commands, [&](const CommandDescription& each) { return chosen.get_name() == each.name; });
    return found != commands.end() ? &*found : nullptr;
}

const char* nameOf(Argument argument) {
    switch (argument) {
        case Argument::none: return "";
        case Argument::optionalItem:
        case Argument::item: return "ITEM";
        case Argument::path: return "PATH";
        case Argument::application: return "ID";
        case Argument::text: return "TEXT";
        case Argument::tag: return "TAG";
    }
    return "";
}

/// What the chosen command is and is about.
void readCommand(const CLI::App& app, const Words& words, HostOptions& options) {
    const CLI::App& chosen = chosenApp(app);
    const CommandDescription* description = chosenCommand(app);
    if (description == nullptr) {
        options.command = HostCommand::edit;
        options.edit = words.edit;
        options.edit.command = editCommandNamed(chosen.get_name()).value_or(EditCommand::tags);
        // Without items, these two show what there is.
        if (options.edit.words.empty() && options.edit.command == EditCommand::trash)
            options.command = HostCommand::trashed;
        if (options.edit.words.empty() && options.edit.command == EditCommand::tags)
            options.command = HostCommand::allTags;
        return;
    }
    options.command = description->command;
    options.text = words.text;
    options.limit = words.limit;
    const bool namesNone = description->argument == Argument::none || description->argument == Argument::text ||
                           description->argument == Argument::tag;
    const bool hasItem = !namesNone && chosen.get_option_no_throw(nameOf(description->argument))->count() > 0;
    if (hasItem) options.item = words.item;
}

HostOptions optionsOf(const CLI::App& app, const Words& words, const HostEnvironment& environment) {
    HostOptions options;
    readCommand(app, words, options);
    options.storage = words.storage.empty() ? documentsFolder(environment) : absolutePath(words.storage, environment);
    if (!words.state.empty()) {
        options.state = absolutePath(words.state, environment);
    } else if (!environment.stateHome.empty()) {
        options.state = environment.stateHome + "/cindral";
    }
    for (const std::string& folder : words.applications)
        options.applications.push_back(absolutePath(folder, environment));
    options.said = {!words.storage.empty(), !words.applications.empty(), words.noFlatpak,
                    app.get_option("--recorder")->count() > 0, words.desktopTags};
    options.desktopTags = words.desktopTags;
    options.flatpak = !words.noFlatpak;
    options.recorder = recorderOf(words.recorder);
    options.json = words.json;
    options.endsWithNul = words.endsWithNul;
    options.intoPackages = words.intoPackages;
    options.since = words.since;
    if (words.http || words.httpPort != 0) options.httpPort = words.httpPort;
    options.uploadBytesMax = words.uploadBytesMax;
    options.outputFile = words.outputFile == "-" ? "-" : absolutePath(words.outputFile, environment);
    return options;
}

std::string withLineEnd(std::string text) {
    if (!text.ends_with('\n')) text += '\n';
    return text;
}

HostReply usageReply(std::string_view message) {
    return {kExitUsage, fmt::format("cindral: {}\n", terminalText(message))};
}

std::string helpText(const CLI::App& app) {
    const auto chosen = app.get_subcommands();
    if (chosen.empty()) return screenHelp(app);
    // The options stand with the program, before or after any command.
    return chosenApp(app).help(app.get_name()) + "\nOptions of every command: cindral --help\n";
}

/// What is wrong where no command was found. The library says that one is missing also of a word that is none.
std::string missingCommandText(const CLI::App& app, const CLI::ParseError& error) {
    if (error.get_name() != "RequiredError") return error.what();
    const std::vector<std::string> rest = app.remaining();
    const std::string what =
        rest.empty() ? "a command is missing" : fmt::format("there is no command \"{}\"", rest.front());
    return what + "; cindral --help says which there are";
}

}  // namespace

std::string_view recorderChoiceName(RecorderChoice choice) {
    switch (choice) {
        case RecorderChoice::automatic: return "auto";
        case RecorderChoice::inotify: return "inotify";
        case RecorderChoice::fanotify: return "fanotify";
    }
    return "auto";
}

RosterSources rosterSources(const HostOptions& options, const HostEnvironment& environment) {
    RosterSources sources = environment.roster;
    if (!options.flatpak) sources.flatpakUser = sources.flatpakSystem = sources.flatpakConfig = "";
    sources.entryFolders = options.applications;
    sources.storage = options.storage;
    return sources;
}

std::variant<HostOptions, HostReply> parseHostOptions(std::span<const std::string> words,
                                                      const HostEnvironment& environment) {
    CLI::App app("Cindral shows a folder of documents as items with lasting identifiers.", "cindral");
    Words parsed;
    addOptions(app, parsed);
    addCommands(app, parsed);
    addEditCommands(app, parsed.edit);
    app.set_version_flag("--version", fmt::format("cindral {}", hostVersion()), "Print the version and exit.");
    app.set_help_flag("-h,--help", "Say what can be said and exit.");
    for (const char* name : kListCommands) {
        app.get_subcommand(name)
            ->add_flag("-0,--null", parsed.endsWithNul,
                       "Print bare paths (or names) alone, as they are, each with a NUL behind it.")
            ->excludes(app.get_option("--json"));
    }
    addShellTexts(app);
    for (CLI::App* command : app.get_subcommands({})) {
        command->group(groupOf(command->get_name()));
        command->set_help_flag("-h,--help", "Say what can be said and exit.");
        for (CLI::App* inner : command->get_subcommands({}))
            inner->set_help_flag("-h,--help", "Say what can be said and exit.");
    }
    app.require_subcommand(1);
    app.footer("Exit status: 0 done; 1 the operation failed; 2 the call's words are off.");

    app.get_formatter()->label("SUBCOMMAND", "COMMAND");
    app.get_formatter()->label("Subcommands", "Commands");

    try {
        // The library takes words from the end of the list.
        app.parse(std::vector<std::string>(words.rbegin(), words.rend()));
    } catch (const CLI::CallForHelp&) {
        return HostReply{kExitDone, helpText(app)};
    } catch (const CLI::CallForVersion& version) {
        return HostReply{kExitDone, withLineEnd(version.what())};
    } catch (const CLI::ParseError& error) {
        return usageReply(app.get_subcommands().empty() ? missingCommandText(app, error) : error.what());
    }
    return optionsOf(app, parsed, environment);
}

}  // namespace cindral
