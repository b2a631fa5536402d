#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "host/EditOptions.h"
#include "host/HostEnvironment.h"

namespace cindral {

enum class HostCommand {
    ls,
    tree,
    info,
    url,
    id,
    anchor,
    changes,
    watch,
    status,
    doctor,
    rpc,
    serve,
    link,
    edit,
    thumbnail,
    find,
    recents,
    tagged,
    favorites,
    trashed,  ///< trash without items
    allTags,  ///< tags without items
    apps,
    appsEnable,
    appsDisable
};
enum class RecorderChoice { automatic, inotify, fanotify };
/// "auto", "inotify", "fanotify".
std::string_view recorderChoiceName(RecorderChoice choice);

/// What the words of the call say.
///
/// Thread safety: a value.
struct HostOptions {
    HostCommand command = HostCommand::tree;
    std::optional<std::string> item;        ///< identifier or path, as written; of an application: its identifier
    std::string storage;                    ///< absolute, as written or the default; empty when nothing says where
    std::string state;                      ///< the same
    std::vector<std::string> applications;  ///< absolute
    bool flatpak = true;
    bool desktopTags = false;
    RecorderChoice recorder = RecorderChoice::automatic;
    bool json = false;
    bool endsWithNul = false;                    ///< lists: bare names, each with a NUL behind it
    bool intoPackages = false;                   ///< tree
    EditOptions edit;                            ///< edit
    std::string since;                           ///< changes: an anchor, as printed
    std::string outputFile;                      ///< thumbnail: absolute, or "-"
    std::string text;                            ///< find: what is looked for; tagged: the tag
    std::uint64_t limit = UINT64_MAX;            ///< of the items that a search prints
    std::optional<std::uint16_t> httpPort;       ///< serve: also to browsers; 0 for any that is free
    std::uint64_t uploadBytesMax = 64ULL << 30;  ///< serve: of one document that a browser sends
    /// Which of them the call's words say; the others are defaults.
    struct Said {
        bool storage = false;
        bool applications = false;
        bool flatpak = false;
        bool recorder = false;
        bool desktopTags = false;
    } said;
};

/// Where applications are looked for: the environment's sources, and what the options say of them.
RosterSources rosterSources(const HostOptions& options, const HostEnvironment& environment);

/// What there is to say instead of working: help, the version, or what is wrong with the call's words.
struct HostReply {
    int exitStatus = 0;
    std::string text;  ///< for standard output where the status is 0, else for standard error; ends with a newline
};

/// Reads the words after the program's name. Options stand before or after the command.
std::variant<HostOptions, HostReply> parseHostOptions(std::span<const std::string> words,
                                                      const HostEnvironment& environment);

}  // namespace cindral
