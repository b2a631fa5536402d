#pragma once

#include <functional>
#include <optional>
#include <string>

#include "platform/roster/RosterSources.h"

namespace cindral {

/// What the host takes from the process's surroundings, read once.
///
/// Thread safety: a value.
struct HostEnvironment {
    std::string home;           ///< absolute; empty when there is none
    std::string configHome;     ///< $XDG_CONFIG_HOME, else ~/.config
    std::string stateHome;      ///< $XDG_STATE_HOME, else ~/.local/state
    std::string runtimeFolder;  ///< $XDG_RUNTIME_DIR; empty when there is none
    std::string workingFolder;  ///< what relative paths are relative to
    bool wantsColor = false;    ///< standard output is a terminal that can, and nobody asked for none
    bool hasLogLevel = false;   ///< $CINDRAL_LOG is set
    RosterSources roster;       ///< where applications are looked for, without what the call's words say

    using Lookup = std::function<std::optional<std::string>(const char* name)>;
    /// From the variables alone. Relative values of the XDG variables are ignored, as their convention asks.
    static HostEnvironment from(const Lookup& lookup, std::string accountHome, std::string workingFolder,
                                bool outputIsTerminal);
    static HostEnvironment ofProcess();
};

/// The documents folder that the person chose in user-dirs.dirs, else "Documents" in the home folder; empty without a
/// home.
std::string documentsFolder(const HostEnvironment& environment);
/// The same from the file's text. What is neither absolute nor below $HOME counts as not said; nothing is expanded or
/// run.
std::optional<std::string> documentsFolderFrom(std::string_view userDirectories, std::string_view home);

}  // namespace cindral
