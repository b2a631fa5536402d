#include "platform/roster/RosterSources.h"

#include "platform/foundation/DataDirectories.h"
#include "platform/roster/KeyFile.h"

namespace cindral {

RosterSources RosterSources::from(const Lookup& lookup, const std::string& home) {
    const auto folder = [&](const char* variable, std::string other) {
        const auto value = lookup(variable);
        return value && value->starts_with('/') ? *value : std::move(other);
    };
    RosterSources sources;
    sources.home = home;
    const std::string dataHome = folder("XDG_DATA_HOME", home.empty() ? "" : home + "/.local/share");
    sources.flatpakUser = folder("FLATPAK_USER_DIR", dataHome.empty() ? "" : dataHome + "/flatpak");
    sources.flatpakSystem = folder("FLATPAK_SYSTEM_DIR", "/var/lib/flatpak");
    sources.flatpakConfig = folder("FLATPAK_CONFIG_DIR", "/etc/flatpak");
    if (!home.empty()) sources.applicationData = home + "/.var/app";

    // As the C library chooses the language of messages: the first that is set and not empty.
    for (const char* variable : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        const auto value = lookup(variable);
        if (!value || value->empty()) continue;
        sources.localeNames = cindral::localeNames(*value);
        break;
    }
    const std::string dirs = lookup("XDG_DATA_DIRS").value_or("");
    sources.dataFolders = dataDirectories(home.c_str(), dataHome.c_str(), dirs.c_str());
    return sources;
}

}  // namespace cindral
