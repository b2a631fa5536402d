#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/UniqueFd.h"
#include "platform/roster/KeyFile.h"
#include "platform/roster/PersonalChoices.h"
#include "platform/roster/Roster.h"
#include "platform/roster/RosterFiles.h"
#include "platform/roster/RosterSources.h"

namespace cindral {

/// What a look at the sources depends on, by folder: names in it that came, went or lead elsewhere, or all of them; and
/// whether the contents of its files count.
struct RosterInterest {
    std::set<std::string> names;
    bool isEveryName = false;
    bool isContents = false;
};
using RosterInterests = std::map<std::string, RosterInterest>;

/// What a look at the sources found.
struct RosterContents {
    std::vector<InstalledApplication> applications;  ///< type 0 first; in each, a stable order
    RosterInterests interests;
};

/// Looks at the sources of applications.
///
/// Of several applications with one identifier the first counts: the person's own Flatpak installation, those for
/// everybody by their priority, then the folders of desktop entries as they were given.
///
/// Thread safety: for one thread at a time.
class RosterScanner {
public:
    explicit RosterScanner(RosterSources sources) : sources_(std::move(sources)) {}

    /// Of the files that are being written, what was in them at the last look counts.
    RosterContents scan(const std::set<std::string>& filesBeingWritten = {});

private:
    struct Found;
    struct Installation;
    class Look;

    RosterSources sources_;
    /// The desktop entries of the last look by path; none for what is no desktop entry.
    std::map<std::string, std::optional<KeyFile>> entries_;
};

}  // namespace cindral
