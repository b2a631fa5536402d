#include "host/ShellTexts.h"

#include <fmt/format.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <functional>
#include <string_view>
#include <vector>

namespace cindral {
namespace {

constexpr std::size_t kScreenColumns = 80;

struct WrittenOption {
    std::vector<std::string> names;  ///< with their dashes, short ones first
    std::string value;               ///< the kind of value that follows; empty for a flag
    std::vector<std::string> choices;
    std::string description;
};

struct Operand {
    std::string name;
    std::string synopsis;  ///< "ITEM", "[ITEM]", "ITEM..."
    std::string description;
};

struct Group {
    std::string name;
    std::vector<const CLI::App*> commands;
};

std::vector<WrittenOption> optionsOf(const CLI::App& app) {
    std::vector<WrittenOption> options;
    for (const CLI::Option* option : app.get_options()) {
        // Options without a group are not for people.
        if (option->get_positional() || option->get_group().empty()) continue;
        WrittenOption& written = options.emplace_back();
        for (const std::string& name : option->get_snames()) written.names.push_back("-" + name);
        for (const std::string& name : option->get_lnames()) written.names.push_back("--" + name);
        written.description = option->get_description();
        if (option->get_type_size() == 0) continue;
        // "HOW:{a,b}": what is checked stands behind the kind.
        const std::string type = option->get_type_name();
        written.value = type.substr(0, type.find(':'));
        const std::size_t open = type.find('{');
        const std::size_t close = type.find('}');
        if (open == std::string::npos || close == std::string::npos) continue;
        written.choices = CLI::detail::split(type.substr(open + 1, close - open - 1), ',');
    }
    return options;
}

std::vector<Operand> operandsOf(const CLI::App& app) {
    std::vector<Operand> operands;
    for (const CLI::Option* option : app.get_options()) {
        if (!option->get_positional()) continue;
        const std::string name = option->get_name();
        std::string synopsis = name;
        if (option->get_expected_max() > 2) synopsis += "...";
        if (!option->get_required()) synopsis = "[" + synopsis + "]";
        operands.push_back({name, synopsis, option->get_description()});
    }
    return operands;
}

std::vector<Group> groupsOf(const CLI::App& app) {
    std::vector<Group> groups;
    for (const CLI::App* command : app.get_subcommands([](const CLI::App*) { return true; })) {
        auto found = std::ranges::find(groups, command->get_group(), &Group::name);
        if (found == groups.end()) found = groups.insert(groups.end(), {command->get_group(), {}});
        found->commands.push_back(command);
    }
    return groups;
}

std::vector<const CLI::App*> commandsOf(const CLI::App& app) {
    return app.get_subcommands([](const CLI::App*) { return true; });
}

std::string synopsisOf(const CLI::App& command, std::string name) {
    for (const Operand& operand : operandsOf(command)) name += " " + operand.synopsis;
    for (const CLI::Option* option : command.get_options()) {
        if (!option->get_positional() && option->get_required())
            name += fmt::format(" --{} {}", option->get_lnames().front(), option->get_type_name());
    }
    return name;
}

std::string firstSentence(const std::string& text) {
    const std::size_t end = text.find(". ");
    return end == std::string::npos ? text : text.substr(0, end + 1);
}

/// What begins a line, and words behind it, in lines that end before the screen does; those after the first are indented
/// as far.
std::string wrapped(const std::string& begin, const std::string& words) {
    std::string out = begin;
    std::size_t column = begin.size();
    for (const std::string& word : CLI::detail::split(words, ' ')) {
        if (column + 1 + word.size() > kScreenColumns) {
            out += "\n" + std::string(begin.size(), ' ');
            column = begin.size();
        }
        out += " " + word;
        column += 1 + word.size();
    }
    return out + "\n";
}

// MARK: The manual

/// Text of a manual: nothing in it is taken for a request or an escape.
std::string roff(std::string_view text) {
    std::string out;
    for (const char each : text) {
        const bool isLineStart = out.empty() || out.back() == '\n';
        if (isLineStart && (each == '.' || each == '\'')) out += "\\&";
        switch (each) {
            case '\\': out += "\\e"; break;
            case '-': out += "\\-"; break;
            case '~': out += "\\(ti"; break;
            default: out += each;
        }
    }
    return out;
}

void appendOptions(std::string& out, const CLI::App& app) {
    for (const WrittenOption& option : optionsOf(app)) {
        std::string names;
        for (const std::string& name : option.names) names += (names.empty() ? "\\fB" : ", \\fB") + roff(name) + "\\fR";
        if (!option.value.empty()) names += " \\fI" + roff(option.value) + "\\fR";
        out += ".TP\n" + names + "\n" + roff(option.description) + "\n";
    }
}

bool isHelp(const WrittenOption& option) {
    return std::ranges::find(option.names, "--help") != option.names.end();
}

/// A command with what may follow it; "apps enable" is one, too.
void appendCommand(std::string& out, const CLI::App& command, const std::string& before) {
    out += ".TP\n.B " + roff(synopsisOf(command, before + command.get_name())) + "\n" +
           roff(command.get_description()) + "\n";
    std::string more;
    for (const WrittenOption& option : optionsOf(command)) {
        if (isHelp(option)) continue;
        std::string names;
        for (const std::string& name : option.names) names += (names.empty() ? "" : ", ") + name;
        if (!option.value.empty()) names += " " + option.value;
        more += ".TP\n.B " + roff(names) + "\n" + roff(option.description) + "\n";
    }
    if (!command.get_footer().empty()) more += ".PP\n.nf\n" + roff(command.get_footer()) + "\n.fi\n";
    if (!more.empty()) out += ".RS\n" + more + ".RE\n";
    for (const CLI::App* inner : commandsOf(command)) appendCommand(out, *inner, command.get_name() + " ");
}

constexpr const char* kManualNaming = R"(.SH NAMING ITEMS
Wherever a command takes an
.IR ITEM ,
it takes an identifier or a path.
Identifiers are
.BI did= NUMBER
of a document,
.BI fid= NUMBER
of any file or folder,
.BI # APPLICATION
of an application's documents, and the well\-known names of containers.
They stay what they are when the item is renamed, moved or saved.
All else is a path, absolute or relative to the working folder;
.B ./did=1
is the file of that name.
What begins with
.B \-
goes after
.BR \-\- .
.SH OUTPUT
Names are escaped, so that none can write to the screen: control characters, and what is not UTF\-8, become
.BI \ex NN\c
\&.
Colour is for terminals, unless
.B NO_COLOR
is set.
.B \-\-json
and
.B \-0
are for programs: the first writes one JSON value a line, the second the paths of items as they are
(or identifiers, of items without a path), each with a NUL behind it, which
.BR xargs (1)
takes with its own
.BR \-0 ,
and every command as
.IR ITEM .
)";

constexpr const char* kManualRest = R"(.SH EXIT STATUS
.TP
.B 0
done
.TP
.B 1
the operation failed; standard error has a line that says why
.TP
.B 2
the call's words are off
.SH ENVIRONMENT
.TP
.B XDG_STATE_HOME
where the state folder is, unless
.B \-\-state
says otherwise
.TP
.B XDG_RUNTIME_DIR
where the daemon's socket is
.TP
.B NO_COLOR
set and not empty: no colour
.TP
.B CINDRAL_LOG
how much is logged to standard error:
.BR error ,
.BR warning ,
.B info
or
.B debug
.SH FILES
.TP
.I $XDG_STATE_HOME/cindral
what the host knows; documents are not in it
.TP
.I $XDG_STATE_HOME/cindral/socket
leads to the daemon's socket, where programs speak JSON\-RPC 2.0, a message a line
.SH EXAMPLES
.TP
.B systemctl \-\-user enable \-\-now cindral.socket
Have the daemon started by the first command that looks for it.
.TP
.B cindral find report \-0 | xargs \-0 wc \-c
Count the bytes of what has \(lqreport\(rq in its name.
.TP
.B cindral changes TesselWorkingSetContainerItemIdentifier \-\-since \(dq$(cat anchor)\(dq
Say what has changed since an anchor was kept.
)";

// MARK: Completions

bool isPathKind(std::string_view kind) {
    return kind.find("ITEM") != std::string_view::npos || kind == "PATH" || kind == "FILE" || kind == "FOLDER";
}

bool takesPaths(const CLI::App& command) {
    return std::ranges::any_of(operandsOf(command), [](const Operand& operand) { return isPathKind(operand.name); });
}

std::string replaced(std::string_view text, std::string_view from, std::string_view to) {
    std::string out(text);
    for (std::size_t at = 0; (at = out.find(from, at)) != std::string::npos; at += to.size())
        out.replace(at, from.size(), to);
    return out;
}

/// Single quotes, as bash and zsh read them.
std::string shellQuoted(std::string_view text) {
    return "'" + replaced(text, "'", "'\\''") + "'";
}

std::string namesOf(const std::vector<WrittenOption>& options, const std::function<bool(const WrittenOption&)>& isMeant,
                    std::string_view between) {
    std::vector<std::string> names;
    for (const WrittenOption& option : options) {
        if (isMeant(option)) names.insert(names.end(), option.names.begin(), option.names.end());
    }
    return fmt::format("{}", fmt::join(names, between));
}

bool isAny(const WrittenOption&) {
    return true;
}

/// Every option, of whatever command.
std::vector<WrittenOption> allOptionsOf(const CLI::App& app) {
    std::vector<WrittenOption> all = optionsOf(app);
    for (const CLI::App* command : commandsOf(app)) {
        for (WrittenOption& option : optionsOf(*command)) {
            const bool isKnown =
                std::ranges::any_of(all, [&](const WrittenOption& each) { return each.names == option.names; });
            if (!isKnown) all.push_back(std::move(option));
        }
    }
    return all;
}

/// What may stand where the command's own words do.
std::string wordsOf(const CLI::App& command, const std::vector<WrittenOption>& common) {
    std::string words;
    for (const CLI::App* inner : commandsOf(command)) words += inner->get_name() + " ";
    const auto own = [](const WrittenOption& option) { return !isHelp(option); };
    const std::string names = namesOf(optionsOf(command), own, " ");
    if (!names.empty()) words += names + " ";
    return words + namesOf(common, isAny, " ");
}

std::string bashCompletion(const CLI::App& app) {
    const auto common = optionsOf(app);
    const auto all = allOptionsOf(app);
    const auto valued = [](const WrittenOption& option) { return !option.value.empty(); };
    std::string out = "# bash completion for cindral\n\n_cindral() {\n";
    out += "    local current=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]}\n";
    out += "    local command= words= paths= i\n    COMPREPLY=()\n";
    out += "    for ((i = 1; i < COMP_CWORD; i++)); do\n        case ${COMP_WORDS[i]} in\n";
    out += "            " + namesOf(all, valued, " | ") + ") ((i++)) ;;\n            -*) ;;\n";
    out += "            *) command=${COMP_WORDS[i]} && break ;;\n        esac\n    done\n";

    out += "    case $previous in\n";
    for (const WrittenOption& option : all) {
        if (option.value.empty()) continue;
        const std::string names = fmt::format("{}", fmt::join(option.names, " | "));
        if (option.value == "DIR") {
            out += fmt::format(
                "        {}) compopt -o filenames; mapfile -t COMPREPLY < <(compgen -d -- \"$current\"); "
                "return ;;\n",
                names);
        } else if (isPathKind(option.value)) {
            out += fmt::format(
                "        {}) compopt -o filenames; mapfile -t COMPREPLY < <(compgen -f -- \"$current\"); "
                "return ;;\n",
                names);
        } else {
            out += fmt::format("        {}) mapfile -t COMPREPLY < <(compgen -W '{}' -- \"$current\"); return ;;\n",
                               names, fmt::join(option.choices, " "));
        }
    }
    out += "    esac\n    case $command in\n";
    std::vector<std::string> names;
    for (const CLI::App* command : commandsOf(app)) names.push_back(command->get_name());
    out += fmt::format("        '') words='{} {}' ;;\n", fmt::join(names, " "), namesOf(common, isAny, " "));
    for (const CLI::App* command : commandsOf(app)) {
        out += fmt::format("        {}) words='{}'{} ;;\n", command->get_name(), wordsOf(*command, common),
                           takesPaths(*command) ? " paths=1" : "");
    }
    out += "    esac\n";
    out += "    if [[ -n $paths && $current != -* ]]; then\n        compopt -o filenames\n";
    out += "        mapfile -t COMPREPLY < <(compgen -f -- \"$current\")\n    else\n";
    out += "        mapfile -t COMPREPLY < <(compgen -W \"$words\" -- \"$current\")\n    fi\n}\n";
    return out + "complete -F _cindral cindral\n";
}

/// A description inside of brackets, or behind a colon.
std::string zshText(const std::string& text) {
    std::string out;
    for (const char each : firstSentence(text)) {
        if (each == '[' || each == ']' || each == ':' || each == '\\') out += '\\';
        out += each;
    }
    return out;
}

std::string zshOption(const WrittenOption& option) {
    std::string value;
    if (!option.choices.empty()) {
        value = fmt::format(":{}:({})", option.value, fmt::join(option.choices, " "));
    } else if (!option.value.empty()) {
        const char* files = option.value == "DIR" ? "_files -/" : isPathKind(option.value) ? "_files" : " ";
        value = fmt::format(":{}:{}", option.value, files);
    }
    std::string out;
    for (const std::string& name : option.names)
        out += "        " + shellQuoted(fmt::format("{}[{}]{}", name, zshText(option.description), value)) + "\n";
    return out;
}

std::string zshCompletion(const CLI::App& app) {
    std::string out = "#compdef cindral\n\n_cindral() {\n    local curcontext=$curcontext state line\n";
    out += "    local -a common commands\n    common=(\n";
    for (const WrittenOption& option : optionsOf(app)) out += zshOption(option);
    out += "    )\n    commands=(\n";
    for (const CLI::App* command : commandsOf(app)) {
        out += "        " +
               shellQuoted(fmt::format("{}:{}", command->get_name(), zshText(command->get_description()))) + "\n";
    }
    out += "    )\n    _arguments -C $common '1:command:->command' '*::word:->word'\n    case $state in\n";
    out += "        command) _describe command commands; return ;;\n        word) ;;\n        *) return ;;\n    esac\n";
    out += "    local -a own\n    case $words[1] in\n";
    for (const CLI::App* command : commandsOf(app)) {
        out += fmt::format("    {})\n        own=(\n", command->get_name());
        for (const WrittenOption& option : optionsOf(*command)) {
            if (!isHelp(option)) out += zshOption(option);
        }
        std::vector<std::string> inner;
        for (const CLI::App* each : commandsOf(*command)) inner.push_back(each->get_name());
        if (!inner.empty()) {
            out += "        " + shellQuoted(fmt::format("1:command:({})", fmt::join(inner, " "))) + "\n";
        } else if (takesPaths(*command)) {
            out += "        '*:item:_files'\n";
        }
        out += "        ) ;;\n";
    }
    return out + "    esac\n    _arguments $common $own\n}\n\n_cindral \"$@\"\n";
}

std::string fishText(const std::string& text) {
    return "'" + replaced(replaced(firstSentence(text), "\\", "\\\\"), "'", "\\'") + "'";
}

std::string fishOption(const WrittenOption& option, const std::string& condition) {
    std::string line = "complete -c cindral" + condition;
    for (const std::string& name : option.names)
        line += name.starts_with("--") ? " -l " + name.substr(2) : " -s " + name.substr(1);
    if (!option.choices.empty()) {
        line += fmt::format(" -x -a '{}'", fmt::join(option.choices, " "));
    } else if (option.value == "DIR") {
        line += " -x -a '(__fish_complete_directories)'";
    } else if (!option.value.empty()) {
        line += isPathKind(option.value) ? " -r -F" : " -x";
    }
    return line + " -d " + fishText(option.description) + "\n";
}

std::string fishCompletion(const CLI::App& app) {
    std::string out = "# fish completion for cindral\n\ncomplete -c cindral -f\n";
    for (const WrittenOption& option : optionsOf(app)) out += fishOption(option, "");
    for (const CLI::App* command : commandsOf(app)) {
        const std::string& name = command->get_name();
        out += fmt::format("complete -c cindral -n __fish_use_subcommand -a {} -d {}\n", name,
                           fishText(command->get_description()));
        const std::string condition = fmt::format(" -n '__fish_seen_subcommand_from {}'", name);
        for (const CLI::App* inner : commandsOf(*command)) {
            out += fmt::format("complete -c cindral{} -a {} -d {}\n", condition, inner->get_name(),
                               fishText(inner->get_description()));
        }
        for (const WrittenOption& option : optionsOf(*command)) {
            if (!isHelp(option)) out += fishOption(option, condition);
        }
        if (takesPaths(*command)) out += fmt::format("complete -c cindral{} -F\n", condition);
    }
    return out;
}

}  // namespace

std::string screenHelp(const CLI::App& app) {
    std::string out =
        fmt::format("Usage: {} COMMAND [WORD...] [OPTION...]\n{}\n\n", app.get_name(), app.get_description());
    for (const Group& group : groupsOf(app)) {
        std::vector<std::string> names;
        for (const CLI::App* command : group.commands) names.push_back(command->get_name());
        out += wrapped(fmt::format("  {:<11}", group.name), fmt::format("{}", fmt::join(names, " ")));
    }
    out += "\nOptions, before or after the command:\n";
    for (const WrittenOption& option : optionsOf(app)) {
        std::string names = fmt::format("{}", fmt::join(option.names, ", "));
        if (!option.value.empty()) names += " " + option.value;
        out += wrapped(fmt::format("  {:<14} ", names), firstSentence(option.description));
    }
    return out + "\ncindral COMMAND --help says more of a command, and man cindral of all.\n" + app.get_footer() + "\n";
}

std::string manualText(const CLI::App& app, const std::string& version) {
    std::string out = fmt::format(".TH CINDRAL 1 \"\" \"cindral {}\" \"User Commands\"\n", roff(version));
    out += ".SH NAME\ncindral \\- items with lasting identifiers for a folder of documents\n";
    out += ".SH SYNOPSIS\n.B cindral\n.I COMMAND\n.RI [ WORD ...]\n.RI [ OPTION ...]\n";
    out += ".SH DESCRIPTION\n" + roff(app.get_description()) + "\n";
    out +=
        "The identifiers stay when a file is renamed, moved or saved by any editor; the files stay ordinary files.\n"
        ".PP\nEach command works by the daemon of its state folder,\n.BR \"cindral serve\" ,\nwhere one runs, "
        "and alone otherwise. The answers are the same.\n";
    out += ".SH COMMANDS\n";
    for (const Group& group : groupsOf(app)) {
        out += ".SS " + roff(group.name) + "\n";
        for (const CLI::App* command : group.commands) appendCommand(out, *command, "");
    }
    out += ".SH OPTIONS\nThey stand before or after any command.\n";
    appendOptions(out, app);
    return out + kManualNaming + kManualRest;
}

std::string completionText(const CLI::App& app, const std::string& shell) {
    if (shell == "bash") return bashCompletion(app);
    if (shell == "zsh") return zshCompletion(app);
    return shell == "fish" ? fishCompletion(app) : "";
}

}  // namespace cindral
