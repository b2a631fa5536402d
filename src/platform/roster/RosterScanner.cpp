#include "platform/roster/RosterScanner.h"

#include <fcntl.h>
#include <fmt/format.h>

#include <algorithm>
#include <charconv>

#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"

namespace cindral {
namespace {

using roster_files::Links;

constexpr std::string_view kEntryGroup = "Desktop Entry";
constexpr std::string_view kMetadataGroup = "Application";
constexpr std::string_view kEntrySuffix = ".desktop";
constexpr const char* kDocumentsName = "Documents";
constexpr std::string_view kDataContainerKey = "X-Cindral-DataContainer";
constexpr const char* kMissingWhy = "its Documents folder is missing";

struct InfoKey {
    const char* entry;
    const char* info;
};
constexpr InfoKey kInfoKeys[] = {
    {"X-Cindral-SupportsDocumentBrowser", kSupportsDocumentBrowserKey},
    {"X-Cindral-SupportsOpenInPlace", kSupportsOpenInPlaceKey},
    {"X-Cindral-FileSharingEnabled", kFileSharingEnabledKey},
};

constexpr unsigned kUserInstalledType = 0;
constexpr unsigned kOtherType = 2;

/// Whether a desktop entry is all there, and says that it is an application.
bool isApplicationEntry(const KeyFile& file) {
    const std::string* type = file.value(kEntryGroup, "Type");
    const std::string* name = file.value(kEntryGroup, "Name");
    return type != nullptr && *type == "Application" && name != nullptr && !name->empty();
}

void addInfo(PropertyList::Dictionary& info, const KeyFile& file, std::string_view group) {
    for (const InfoKey& key : kInfoKeys) {
        if (const auto value = file.boolean(group, key.entry)) info.insert_or_assign(key.info, PropertyList(*value));
    }
}

void applyChoice(PropertyList::Dictionary& info, PersonalChoices::Choice choice) {
    const bool enabled = choice == PersonalChoices::Choice::enabled;
    info.insert_or_assign(kSupportsDocumentBrowserKey, PropertyList(enabled));
    if (enabled) return;
    info.insert_or_assign(kSupportsOpenInPlaceKey, PropertyList(false));
    info.insert_or_assign(kFileSharingEnabledKey, PropertyList(false));
}

std::string withoutTrailingSlashes(std::string path) {
    while (path.size() > 1 && path.ends_with('/')) path.pop_back();
    return path;
}

bool isAtOrBelow(std::string_view path, std::string_view folder) {
    return path.starts_with(folder) && (path.size() == folder.size() || folder == "/" || path[folder.size()] == '/');
}

bool overlaps(std::string_view a, std::string_view b) {
    return isAtOrBelow(a, b) || isAtOrBelow(b, a);
}

}  // namespace

/// An application, before what counts for all alike is worked out.
struct RosterScanner::Found {
    std::string identifier;
    unsigned type = kOtherType;
    std::string source;
    std::string name;
    std::string container;  ///< empty when nothing says
    std::optional<PropertyList::Dictionary> info;
    std::shared_ptr<const ApplicationIcon> icon;
};

struct RosterScanner::Installation {
    std::string path;
    unsigned type = kOtherType;
    std::string source;
    int priority = 0;
};

class RosterScanner::Look {
public:
    Look(RosterScanner& scanner, const std::set<std::string>& filesBeingWritten)
        : sources_(scanner.sources_), entriesBefore_(scanner.entries_), filesBeingWritten_(filesBeingWritten) {}

    RosterContents take() {
        follow(sources_.choicesFile);
        if (!sources_.choicesFile.empty()) choices_ = PersonalChoices::read(sources_.choicesFile);
        lookAtStorage();
        for (const Installation& installation : installations()) lookAtInstallation(installation);
        for (const std::string& folder : sources_.entryFolders) lookAtEntries(folder);
        std::ranges::stable_sort(contents_.applications, {}, [](const auto& each) { return each.type; });
        return std::move(contents_);
    }
    std::map<std::string, std::optional<KeyFile>> entries() { return std::move(entries_); }

private:
    // What the look depends on.

    void follow(const std::string& path) {
        for (auto& [folder, name] : stepsOf(path)) contents_.interests[folder].names.insert(std::move(name));
    }
    void followEveryName(const std::string& folder) {
        follow(folder);
        contents_.interests[withoutTrailingSlashes(folder)].isEveryName = true;
    }
    void followContents(const std::string& folder) {
        followEveryName(folder);
        contents_.interests[withoutTrailingSlashes(folder)].isContents = true;
    }

    // Flatpak.

    std::vector<Installation> installations() {
        std::vector<Installation> all;
        if (!sources_.flatpakUser.empty())
            all.push_back({sources_.flatpakUser, kUserInstalledType, "Flatpak, for this person", 0});
        std::vector<Installation> shared;
        if (!sources_.flatpakSystem.empty())
            shared.push_back({sources_.flatpakSystem, kOtherType, "Flatpak, for everybody", 0});
        if (!sources_.flatpakConfig.empty()) addConfigured(shared);
        std::ranges::stable_sort(shared, std::ranges::greater(), &Installation::priority);
        all.insert(all.end(), shared.begin(), shared.end());
        return all;
    }

    void addConfigured(std::vector<Installation>& installations) {
        const std::string folder = sources_.flatpakConfig + "/installations.d";
        followContents(folder);
        const auto opened = roster_files::openFolder(AT_FDCWD, folder, Links::anywhere);
        if (!opened) return;
        for (const std::string& name : roster_files::names(opened->get())) {
            if (!name.ends_with(".conf")) continue;
            const auto file = roster_files::readKeyFile(opened->get(), name, Links::anywhere);
            if (file) addInstallationsOf(*file, installations);
        }
    }

    static void addInstallationsOf(const KeyFile& file, std::vector<Installation>& installations) {
        static constexpr std::string_view kHead = "Installation \"";
        for (const std::string& group : file.groups()) {
            if (!group.starts_with(kHead) || !group.ends_with('"') || group.size() <= kHead.size() + 1) continue;
            const auto path = file.string(group, "Path");
            if (!path || !path->starts_with('/')) continue;
            Installation installation{withoutTrailingSlashes(*path), kOtherType, "", 0};
            const std::string id = group.substr(kHead.size(), group.size() - kHead.size() - 1);
            installation.source = fmt::format("Flatpak, installation {}", id);
            if (const std::string* priority = file.value(group, "Priority"))
                std::from_chars(priority->data(), priority->data() + priority->size(), installation.priority);
            installations.push_back(std::move(installation));
        }
    }

    void lookAtInstallation(const Installation& installation) {
        const std::string applications = installation.path + "/app";
        followEveryName(applications);
        const auto folder = roster_files::openFolder(AT_FDCWD, applications, Links::anywhere);
        if (!folder) return;
        for (const std::string& identifier : roster_files::names(folder->get()))
            lookAtFlatpak(installation, applications, folder->get(), identifier);
    }

    void lookAtFlatpak(const Installation& installation, const std::string& applications, int folder,
                       const std::string& identifier) {
        // Two links that an update replaces: both are followed, and all is read through the folder that was opened.
        const std::string deployment = identifier + "/current/active";
        follow(applications + "/" + deployment);
        const auto active = roster_files::openFolder(folder, deployment, Links::beneath);
        if (!active) return;
        const auto metadata = roster_files::readKeyFile(active->get(), "metadata", Links::beneath);
        const auto entry = roster_files::readKeyFile(
            active->get(), fmt::format("export/share/applications/{}{}", identifier, kEntrySuffix), Links::beneath);

        Found found;
        found.identifier = identifier;
        found.type = installation.type;
        found.source = installation.source;
        if (!sources_.applicationData.empty()) found.container = sources_.applicationData + "/" + identifier;
        if (metadata || entry) found.info.emplace();
        if (metadata) addInfo(*found.info, *metadata, kMetadataGroup);
        std::string icon = identifier;
        if (entry) {
            addInfo(*found.info, *entry, kEntryGroup);
            found.name = entry->localizedString(kEntryGroup, "Name", sources_.localeNames).value_or("");
            icon = entry->localizedString(kEntryGroup, "Icon", sources_.localeNames).value_or(icon);
        }
        found.icon = ApplicationIcon::exported(std::move(icon), applications, deployment);
        add(std::move(found));
    }

    // Desktop entries.

    void lookAtEntries(const std::string& folder) {
        followContents(folder);
        const auto opened = roster_files::openFolder(AT_FDCWD, folder, Links::anywhere);
        if (!opened) return;
        for (const std::string& name : roster_files::names(opened->get())) {
            if (!name.ends_with(kEntrySuffix) || name.size() == kEntrySuffix.size()) continue;
            const std::string path = folder + "/" + name;
            auto& entry = entries_[path];
            const auto before = entriesBefore_.find(path);
            if (!filesBeingWritten_.contains(path)) {
                entry = roster_files::readKeyFile(opened->get(), name, Links::anywhere);
            } else if (before != entriesBefore_.end()) {
                entry = before->second;
            }
            if (entry && isApplicationEntry(*entry)) lookAtEntry(folder, name, *entry);
        }
    }

    void lookAtEntry(const std::string& folder, const std::string& name, const KeyFile& entry) {
        // An entry that is hidden says that the application is not installed.
        if (entry.boolean(kEntryGroup, "Hidden").value_or(false)) return;
        Found found;
        found.identifier = name.substr(0, name.size() - kEntrySuffix.size());
        found.source = folder;
        found.name = entry.localizedString(kEntryGroup, "Name", sources_.localeNames).value_or("");
        found.container = containerOf(entry);
        addInfo(found.info.emplace(), entry, kEntryGroup);
        if (auto icon = entry.localizedString(kEntryGroup, "Icon", sources_.localeNames))
            found.icon = iconOf(*std::move(icon), folder);
        add(std::move(found));
    }

    std::string containerOf(const KeyFile& entry) const {
        const std::string said = entry.string(kEntryGroup, kDataContainerKey).value_or("");
        std::string path = said;
        if (said.starts_with("file:")) {
            const auto url = KsURL::parse(said);
            path = url ? url->path() : "";
        } else if (said.starts_with("~/") && !sources_.home.empty()) {
            path = sources_.home + said.substr(1);
        }
        return path.starts_with('/') ? withoutTrailingSlashes(std::move(path)) : "";
    }

    std::shared_ptr<const ApplicationIcon> iconOf(std::string icon, const std::string& folder) const {
        // Beside the entries first: where they stand in "applications", icons stand in "icons".
        std::vector<std::string> themes{folder + "/icons", folder.substr(0, folder.rfind('/')) + "/icons"};
        std::vector<std::string> loose{folder};
        for (const std::string& data : sources_.dataFolders) {
            themes.push_back(data + "/icons");
            loose.push_back(data + "/pixmaps");
        }
        return ApplicationIcon::named(std::move(icon), std::move(themes), std::move(loose));
    }

    // All alike.

    void lookAtStorage() {
        if (sources_.storage.empty()) return;
        const auto opened = roster_files::openFolder(AT_FDCWD, sources_.storage, Links::anywhere);
        if (!opened) return;
        const Result<FileStatus> status = sys::statx(opened->get(), "");
        if (status.ok()) device_ = status->device;
        if (Result<std::string> real = sys::pathOfDescriptor(opened->get()); real.ok())
            taken_.emplace_back(*std::move(real), "the storage");
    }

    void add(Found found) {
        if (!identifiers_.insert(found.identifier).second) return;
        InstalledApplication application;
        application.type = found.type;
        application.source = std::move(found.source);
        application.container = found.container;
        const auto choice = choices_.of(found.identifier);
        if (choice) {
            application.choice = *choice == PersonalChoices::Choice::enabled;
            if (!found.info) found.info.emplace();
            applyChoice(*found.info, *choice);
        }
        application.whyNoContainer = whyNoContainer(found);

        RoBundleProxy::Values values;
        values.localizedName = found.name.empty() ? found.identifier : std::move(found.name);
        values.bundleIdentifier = std::move(found.identifier);
        if (application.whyNoContainer.empty()) values.dataContainerURL = KsURL::fileURL(std::move(found.container));
        values.infoDictionary = std::move(found.info);
        values.icon = std::move(found.icon);
        application.record = std::make_shared<const RoApplicationProxy>(std::move(values));
        contents_.applications.push_back(std::move(application));
    }

    /// Empty when the Documents folder can be published.
    std::string whyNoContainer(const Found& found) {
        if (found.container.empty()) return "it names no data container";
        const std::string documents = found.container + "/" + kDocumentsName;
        follow(documents);
        const auto container = roster_files::openFolder(AT_FDCWD, found.container, Links::anywhere);
        if (!container) return kMissingWhy;
        // The application may write to its container: what is there may be a link to anywhere.
        const Result<UniqueFd> opened = sys::openat(container->get(), kDocumentsName, O_PATH | O_NOFOLLOW);
        if (!opened.ok()) return kMissingWhy;
        const Result<FileStatus> status = sys::statx(opened->get(), "");
        if (!status.ok() || !status->isDirectory()) return "its Documents is no folder";
        if (device_ && status->device != *device_) {
            if (RootDirectories::shared().noteLeftOut(documents, "it is on another device than the storage"))
                logInfo("leaving out {}; it is on another device than the storage",
                        KsURL::fileURL(documents).description());
            return "its Documents folder is on another device than the storage";
        }
        return whyTaken(opened->get(), found.identifier);
    }

    /// Two roots may not hold one file: it would have two parents.
    std::string whyTaken(int documents, const std::string& identifier) {
        Result<std::string> real = sys::pathOfDescriptor(documents);
        if (!real.ok()) return kMissingWhy;
        for (const auto& [path, owner] : taken_) {
            if (overlaps(*real, path)) return fmt::format("its Documents folder overlaps that of {}", owner);
        }
        taken_.emplace_back(*std::move(real), identifier);
        return {};
    }

    const RosterSources& sources_;
    const std::map<std::string, std::optional<KeyFile>>& entriesBefore_;
    const std::set<std::string>& filesBeingWritten_;

    PersonalChoices choices_;
    std::optional<std::uint64_t> device_;
    std::vector<std::pair<std::string, std::string>> taken_;  ///< real paths of Documents folders, and whose they are
    std::set<std::string> identifiers_;
    std::map<std::string, std::optional<KeyFile>> entries_;
    RosterContents contents_;
};

RosterContents RosterScanner::scan(const std::set<std::string>& filesBeingWritten) {
    Look look(*this, filesBeingWritten);
    RosterContents contents = look.take();
    entries_ = look.entries();
    return contents;
}

}  // namespace cindral
