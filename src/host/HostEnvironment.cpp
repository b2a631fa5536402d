#include "host/HostEnvironment.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <vector>

#include "host/PresentedPaths.h"

namespace cindral {
namespace {

constexpr std::size_t kUserDirectoriesBytesMax = 65'536;

/// The home folder in the account database, for a process that was started without HOME.
std::string accountHome() {
    std::vector<char> buffer(16'384);
    passwd entry{};
    passwd* found = nullptr;
    if (::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found) != 0 || found == nullptr) return {};
    return found->pw_dir;
}

std::string absoluteOr(const std::optional<std::string>& value, std::string other) {
    return value && value->starts_with('/') ? tidyPath(*value) : std::move(other);
}

/// What stands between the quotes of a shell assignment, escapes undone; none when a quote is missing.
std::optional<std::string> quotedValue(std::string_view text) {
    if (!text.starts_with('"')) return std::nullopt;
    text.remove_prefix(1);
    std::string value;
    while (!text.empty() && text.front() != '"') {
        if (text.front() == '\\') text.remove_prefix(1);
        if (text.empty()) return std::nullopt;
        value += text.front();
        text.remove_prefix(1);
    }
    return text.empty() ? std::nullopt : std::optional(std::move(value));
}

std::string_view withoutLeadingBlanks(std::string_view text) {
    return text.substr(std::min(text.find_first_not_of(" \t"), text.size()));
}

/// The value of a line that assigns the variable; none for every other line.
std::optional<std::string> assignedValue(std::string_view line, std::string_view variable) {
    line = withoutLeadingBlanks(line);
    if (!line.starts_with(variable)) return std::nullopt;
    line = withoutLeadingBlanks(line.substr(variable.size()));
    if (!line.starts_with('=')) return std::nullopt;
    return quotedValue(withoutLeadingBlanks(line.substr(1)));
}

/// What a small file holds; empty for anything but a file. A link to one will do: people keep their settings elsewhere
/// and link them.
std::string beginningOf(const std::string& path) {
    std::error_code error;
    if (!std::filesystem::is_regular_file(path, error)) return {};
    std::ifstream stream(path, std::ios::binary);
    std::string text(kUserDirectoriesBytesMax, '\0');
    stream.read(text.data(), static_cast<std::streamsize>(text.size()));
    text.resize(static_cast<std::size_t>(stream.gcount()));
    return text;
}

/// "$HOME/…" and absolute paths only; the home folder itself is the convention's way to say "none".
std::optional<std::string> folderOf(std::string value, std::string_view home) {
    constexpr std::string_view kHome = "$HOME";
    if (value.starts_with(kHome)) {
        if (home.empty()) return std::nullopt;
        const std::string_view below = std::string_view(value).substr(kHome.size());
        if (!below.empty() && !below.starts_with('/')) return std::nullopt;
        value = std::string(home).append(below);
    }
    if (!value.starts_with('/')) return std::nullopt;
    value = tidyPath(value);
    return value == tidyPath(home) ? std::nullopt : std::optional(std::move(value));
}

}  // namespace

HostEnvironment HostEnvironment::from(const Lookup& lookup, std::string accountHome, std::string workingFolder,
                                      bool outputIsTerminal) {
    HostEnvironment environment;
    environment.home = absoluteOr(lookup("HOME"), std::move(accountHome));
    if (!environment.home.empty()) {
        environment.configHome = environment.home + "/.config";
        environment.stateHome = environment.home + "/.local/state";
    }
    environment.configHome = absoluteOr(lookup("XDG_CONFIG_HOME"), environment.configHome);
    environment.stateHome = absoluteOr(lookup("XDG_STATE_HOME"), environment.stateHome);
    environment.runtimeFolder = absoluteOr(lookup("XDG_RUNTIME_DIR"), "");
    environment.workingFolder = std::move(workingFolder);
    environment.roster = RosterSources::from(lookup, environment.home);
    if (!environment.configHome.empty())
        environment.roster.choicesFile = environment.configHome + "/cindral/applications.conf";
    // Set and not empty, whatever the value: https://no-color.org.
    const bool noColor = !lookup("NO_COLOR").value_or("").empty();
    const std::string terminal = lookup("TERM").value_or("");
    environment.wantsColor = outputIsTerminal && !noColor && !terminal.empty() && terminal != "dumb";
    environment.hasLogLevel = lookup("CINDRAL_LOG").has_value();
    return environment;
}

HostEnvironment HostEnvironment::ofProcess() {
    const auto lookup = [](const char* name) -> std::optional<std::string> {
        const char* value = std::getenv(name);
        return value != nullptr ? std::optional<std::string>(value) : std::nullopt;
    };
    // Asking the account database takes as long as a small command; it is for a process that was started without HOME.
    const bool hasHome = lookup("HOME").value_or("").starts_with('/');
    std::error_code error;
    return from(lookup, hasHome ? "" : accountHome(), std::filesystem::current_path(error).string(),
                ::isatty(STDOUT_FILENO) == 1);
}

std::optional<std::string> documentsFolderFrom(std::string_view userDirectories, std::string_view home) {
    std::optional<std::string> folder;
    while (!userDirectories.empty()) {
        const std::size_t end = userDirectories.find('\n');
        // As a shell that reads the file would have it: the last assignment counts.
        if (auto value = assignedValue(userDirectories.substr(0, end), "XDG_DOCUMENTS_DIR"))
            folder = folderOf(*std::move(value), home);
        if (end == std::string_view::npos) break;
        userDirectories.remove_prefix(end + 1);
    }
    return folder;
}

std::string documentsFolder(const HostEnvironment& environment) {
    if (!environment.configHome.empty()) {
        const std::string text = beginningOf(environment.configHome + "/user-dirs.dirs");
        if (auto folder = documentsFolderFrom(text, environment.home)) return *folder;
    }
    return environment.home.empty() ? "" : environment.home + "/Documents";
}

}  // namespace cindral
