#include "platform/roster/Roster.h"

#include <fmt/format.h>

#include <map>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "platform/roster/RosterScanner.h"
#include "platform/roster/RosterWatcher.h"
#include "platform/tessel/NotificationCenter.h"

namespace cindral {
namespace {

constexpr std::string_view kDocuments = "/Documents";

// Written to disk: never change one.
constexpr const char* kClassKey = "class";
constexpr const char* kIdentifierKey = "bundleIdentifier";
constexpr const char* kContainerKey = "dataContainerURL";
constexpr const char* kNameKey = "localizedName";

bool hasParentComponent(std::string_view path) {
    for (std::size_t at = path.find("/.."); at != std::string_view::npos; at = path.find("/..", at + 3)) {
        if (at + 3 == path.size() || path[at + 3] == '/') return true;
    }
    return false;
}

/// What of a path lies below the folder; the top directory's path is the only one that ends with a slash.
std::string_view restBelow(std::string_view path, std::string_view folder) {
    return path.substr(folder == "/" ? 0 : folder.size());
}

const std::string* stringIn(const PropertyList& object, const char* key) {
    const PropertyList* value = object.find(key);
    return value == nullptr ? nullptr : value->string();
}

bool isSameInstallation(const InstalledApplication& a, const InstalledApplication& b) {
    return a.type == b.type && a.whyNoContainer == b.whyNoContainer &&
           a.record->bundleIdentifier() == b.record->bundleIdentifier() &&
           a.record->localizedName() == b.record->localizedName() &&
           a.record->dataContainerURL() == b.record->dataContainerURL() &&
           a.record->objectsForInfoDictionaryKeys(
               {kSupportsDocumentBrowserKey, kSupportsOpenInPlaceKey, kFileSharingEnabledKey}) ==
               b.record->objectsForInfoDictionaryKeys(
                   {kSupportsDocumentBrowserKey, kSupportsOpenInPlaceKey, kFileSharingEnabledKey});
}

}  // namespace

std::string RoBundleProxy::description() const {
    return fmt::format("{} (\"{}\")", values_.bundleIdentifier, values_.localizedName);
}

PropertyList RoBundleProxy::archived() const {
    PropertyList::Dictionary object{{kClassKey, std::string(kArchivedClass)},
                                    {kIdentifierKey, values_.bundleIdentifier},
                                    {kNameKey, values_.localizedName}};
    if (values_.dataContainerURL) object.emplace(kContainerKey, values_.dataContainerURL->absoluteString());
    return object;
}

const std::string* RoBundleProxy::archivedClassOf(const PropertyList& value) {
    return stringIn(value, kClassKey);
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::unarchived(const PropertyList& object) {
    const std::string* name = archivedClassOf(object);
    const std::string* identifier = stringIn(object, kIdentifierKey);
    const std::string* localizedName = stringIn(object, kNameKey);
    if (name == nullptr || *name != kArchivedClass || identifier == nullptr || localizedName == nullptr) return nullptr;
    Values values{*identifier, std::nullopt, *localizedName};
    if (object.find(kContainerKey) != nullptr) {
        const std::string* url = stringIn(object, kContainerKey);
        if (url == nullptr) return nullptr;
        values.dataContainerURL = KsURL::parse(*url);
        if (!values.dataContainerURL || !values.dataContainerURL->isFileURL()) return nullptr;
    }
    return std::make_shared<const RoBundleProxy>(std::move(values));
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::bundleProxyForIdentifier(const std::string& bundleIdentifier) {
    return RoApplicationWorkspace::defaultWorkspace().applicationFor(bundleIdentifier);
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::proxyAt(const KsURL& url) {
    return RoApplicationWorkspace::defaultWorkspace().applicationAt(url);
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::proxyWithContaining(const KsURL& url) {
    return RoApplicationWorkspace::defaultWorkspace().recordContaining(url);
}

std::shared_ptr<const RoApplicationProxy> RoApplicationProxy::applicationProxyForIdentifier(
    const std::string& bundleIdentifier) {
    return RoApplicationWorkspace::defaultWorkspace().applicationFor(bundleIdentifier);
}

std::optional<PropertyList::Dictionary> RoApplicationProxy::objectsForInfoDictionaryKeys(
    const std::set<std::string>& keys) const {
    if (!values_.infoDictionary) return std::nullopt;
    PropertyList::Dictionary objects = *values_.infoDictionary;
    std::erase_if(objects, [&](const auto& each) { return !keys.contains(each.first); });
    return objects;
}

RoApplicationProxy::Publication RoApplicationProxy::publication() const {
    if (!dataContainerURL()) return Publication::hasNoDataContainer;
    if (!objectsForInfoDictionaryKeys({kSupportsDocumentBrowserKey})) return Publication::cannotBeRead;
    const bool isAskedFor = isSet(kSupportsDocumentBrowserKey) || (supportsOpenInPlace() && fileSharingEnabled());
    return isAskedFor ? Publication::published : Publication::isNotAskedFor;
}

bool RoApplicationProxy::isSet(const char* key) const {
    if (!values_.infoDictionary) return false;
    const auto found = values_.infoDictionary->find(key);
    return found != values_.infoDictionary->end() && found->second == PropertyList(true);
}

std::optional<IconData> RoApplicationProxy::iconDataForVariant(int variant) const {
    if (!values_.icon) return std::nullopt;
    switch (variant) {
        case 0:
        case 1: return values_.icon->data(48);
        case 15:
        case 24: return values_.icon->data(96);
        case 32: return values_.icon->data(192);
        default: return std::nullopt;
    }
}

/// What the last look found, made for lookups.
struct RoApplicationWorkspace::Contents {
    std::vector<InstalledApplication> applications;
    std::unordered_map<std::string, const InstalledApplication*> byIdentifier;  ///< into applications
    std::map<std::string, std::shared_ptr<const RoApplicationProxy>, std::less<>> byContainer;

    std::shared_ptr<const RoApplicationProxy> at(std::string_view container) const {
        const auto found = byContainer.find(container);
        return found == byContainer.end() ? nullptr : found->second;
    }
};

RoApplicationWorkspace& RoApplicationWorkspace::defaultWorkspace() {
    static RoApplicationWorkspace& workspace = *new RoApplicationWorkspace;
    return workspace;
}

RoApplicationWorkspace::RoApplicationWorkspace()
    : contents_(std::make_shared<const Contents>()), former_(std::make_shared<const FormerRecords>()) {}

void RoApplicationWorkspace::start(RosterSources sources) {
    stop();
    auto watcher =
        RosterWatcher::start(std::move(sources), [this](RosterContents contents) { setContents(std::move(contents)); });
    const MutexLock lock(mutex_);
    watcher_ = std::move(watcher);
}

void RoApplicationWorkspace::stop() {
    std::shared_ptr<RosterWatcher> watcher;
    {
        const MutexLock lock(mutex_);
        watcher = std::move(watcher_);
    }
    if (watcher) watcher->stop();
    const MutexLock lock(mutex_);
    contents_ = std::make_shared<const Contents>();
    former_ = std::make_shared<const FormerRecords>();
}

void RoApplicationWorkspace::setContents(RosterContents found) {
    auto now = std::make_shared<Contents>();
    now->applications = std::move(found.applications);
    const auto before = contents();
    bool hasCome = false;
    std::size_t kept = 0;
    for (const InstalledApplication& application : now->applications) {
        const auto& record = application.record;
        now->byIdentifier.emplace(record->bundleIdentifier(), &application);
        if (record->dataContainerURL()) now->byContainer.emplace(record->dataContainerURL()->path(), record);
        const auto earlier = before->byIdentifier.find(record->bundleIdentifier());
        const bool wasThere = earlier != before->byIdentifier.end();
        if (wasThere) ++kept;
        hasCome |= !wasThere || !isSameInstallation(*earlier->second, application);
    }
    const bool hasGone = kept < before->applications.size();
    FormerRecords gone;
    for (const InstalledApplication& application : before->applications) {
        const auto& container = application.record->dataContainerURL();
        if (container && !now->at(container->path()))
            gone.emplace(container->path(), FormerRecord{application.record, application.type});
    }
    {
        const MutexLock lock(mutex_);
        contents_ = std::move(now);
        // Of one that went again, the later record.
        gone.insert(former_->begin(), former_->end());
        former_ = std::make_shared<const FormerRecords>(std::move(gone));
    }
    // After the new contents are there: whoever hears of it looks at them.
    if (hasCome) NotificationCenter::distributedCenter()->post(kApplicationRegisteredNotification);
    if (hasGone) NotificationCenter::distributedCenter()->post(kApplicationUnregisteredNotification);
}

std::shared_ptr<const RoApplicationWorkspace::Contents> RoApplicationWorkspace::contents() const {
    const MutexLock lock(mutex_);
    return contents_;
}

void RoApplicationWorkspace::setOwnRecord(std::shared_ptr<const RoBundleProxy> record) {
    // The record that was there goes after the lock.
    const MutexLock lock(mutex_);
    ownRecord_.swap(record);
}

std::shared_ptr<const RoBundleProxy> RoApplicationWorkspace::ownRecord() const {
    const MutexLock lock(mutex_);
    return ownRecord_;
}

void RoApplicationWorkspace::enumerateApplicationsOfType(unsigned type, const Block& block) {
    forgetFormer(type);
    for (const InstalledApplication& application : contents()->applications) {
        if (application.type == type) block(application.record);
    }
}

/// Before the caller is told what is installed: what goes meanwhile may be among it.
void RoApplicationWorkspace::forgetFormer(unsigned type) {
    const MutexLock lock(mutex_);
    FormerRecords kept = *former_;
    std::erase_if(kept, [&](const auto& each) { return each.second.type == type; });
    former_ = std::make_shared<const FormerRecords>(std::move(kept));
}

std::vector<InstalledApplication> RoApplicationWorkspace::applications() const {
    return contents()->applications;
}

std::shared_ptr<const RoApplicationProxy> RoApplicationWorkspace::applicationFor(
    const std::string& bundleIdentifier) const {
    const auto now = contents();
    const auto found = now->byIdentifier.find(bundleIdentifier);
    return found == now->byIdentifier.end() ? nullptr : found->second->record;
}

struct RoApplicationWorkspace::ByContainer {
    std::shared_ptr<const Contents> now;
    std::shared_ptr<const FormerRecords> former;
    std::shared_ptr<const RoBundleProxy> own;

    std::shared_ptr<const RoApplicationProxy> at(std::string_view container) const {
        if (auto record = now->at(container)) return record;
        const auto found = former->find(container);
        return found == former->end() ? nullptr : found->second.record;
    }
};

RoApplicationWorkspace::ByContainer RoApplicationWorkspace::byContainer() const {
    const MutexLock lock(mutex_);
    return {contents_, former_, ownRecord_};
}

std::shared_ptr<const RoApplicationProxy> RoApplicationWorkspace::applicationAt(const KsURL& url) const {
    if (!url.isFileURL()) return nullptr;
    const ByContainer records = byContainer();
    std::string_view path = url.path();
    auto record = records.at(path);
    if (!record && path.ends_with(kDocuments)) {
        path.remove_suffix(kDocuments.size());
        record = records.at(path.empty() ? "/" : path);
    }
    return record;
}

std::shared_ptr<const RoBundleProxy> RoApplicationWorkspace::recordContaining(const KsURL& url) const {
    if (!url.isFileURL()) return nullptr;
    const ByContainer records = byContainer();
    const bool hasOwn = records.own && records.own->dataContainerURL();
    const std::string& path = url.path();
    // From the innermost folder outwards.
    for (std::string_view folder = path; !folder.empty();) {
        if (auto record = records.at(folder)) return hasParentComponent(restBelow(path, folder)) ? nullptr : record;
        if (hasOwn && records.own->dataContainerURL()->path() == folder)
            return hasParentComponent(restBelow(path, folder)) ? nullptr : records.own;
        if (folder == "/") break;
        const std::size_t slash = folder.rfind('/');
        folder = slash == 0 || slash == std::string_view::npos ? std::string_view("/") : folder.substr(0, slash);
    }
    return nullptr;
}

}  // namespace cindral
