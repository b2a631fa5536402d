#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace cindral {

/// Where the registry of applications looks. Paths are absolute; an empty one is not looked at.
///
/// Thread safety: a value.
struct RosterSources {
    std::string flatpakUser;                ///< the person's own Flatpak installation
    std::string flatpakSystem;              ///< the one for everybody
    std::string flatpakConfig;              ///< holds installations.d, which names further ones
    std::string applicationData;            ///< holds the data container of each Flatpak application
    std::string home;                       ///< what "~/" of a desktop entry's data container stands for
    std::vector<std::string> entryFolders;  ///< of desktop entries
    std::string choicesFile;                ///< PersonalChoices
    std::vector<std::string> localeNames;   ///< localeNames() of the process
    std::vector<std::string> dataFolders;   ///< of installed programs: their icons
    std::string storage;                    ///< the document storage: what is not on its device can't be published

    using Lookup = std::function<std::optional<std::string>(const char* name)>;
    /// Flatpak's own places, the locale and the folders of data, as the variables say. `home` is absolute or empty.
    static RosterSources from(const Lookup& lookup, const std::string& home);
};

}  // namespace cindral
