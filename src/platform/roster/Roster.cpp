#include "platform/roster/Roster.h"

#include <fmt/format.h>

#include <string_view>
#include <utility>

namespace cindral {
namespace {

bool hasParentComponent(std::string_view path) {
    for (std::size_t at = path.find("/.."); at != std::string_view::npos; at = path.find("/..", at + 3)) {
        if (at + 3 == path.size() || path[at + 3] == '/') return true;
    }
    return false;
}

/// Whether the path is the folder's or lies below it.
bool isWithin(std::string_view path, std::string_view folder) {
    if (!path.starts_with(folder)) return false;
    // The top directory's path is the only one that ends with a slash.
    const std::string_view rest = path.substr(folder == "/" ? 0 : folder.size());
    return (rest.empty() || rest.front() == '/') && !hasParentComponent(rest);
}

}  // namespace

std::string RoBundleProxy::description() const {
    return fmt::format("{} (\"{}\")", values_.bundleIdentifier, values_.localizedName);
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::bundleProxyForIdentifier(const std::string& /*bundleIdentifier*/) {
    return nullptr;  // No source of applications is connected, and the own record is none of them.
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::proxyAt(const KsURL& /*url*/) {
    return nullptr;  // As above.
}

std::shared_ptr<const RoBundleProxy> RoBundleProxy::proxyWithContaining(const KsURL& url) {
    return RoApplicationWorkspace::defaultWorkspace().recordContaining(url);
}

RoApplicationWorkspace& RoApplicationWorkspace::defaultWorkspace() {
    static RoApplicationWorkspace& workspace = *new RoApplicationWorkspace;
    return workspace;
}

void RoApplicationWorkspace::setOwnRecord(std::shared_ptr<const RoBundleProxy> record) {
    auto kept = std::make_unique<const Record>(std::move(record));
    const MutexLock lock(mutex_);
    ownRecord_.store(kept.get(), std::memory_order_release);
    ownRecords_.push_back(std::move(kept));
}

std::shared_ptr<const RoBundleProxy> RoApplicationWorkspace::ownRecord() const {
    const Record* const record = ownRecord_.load(std::memory_order_acquire);
    return record == nullptr ? nullptr : *record;
}

std::shared_ptr<const RoBundleProxy> RoApplicationWorkspace::recordContaining(const KsURL& url) const {
    const Record* const record = ownRecord_.load(std::memory_order_acquire);
    if (record == nullptr || *record == nullptr || !url.isFileURL()) return nullptr;
    const std::optional<KsURL>& container = (*record)->dataContainerURL();
    if (!container || !isWithin(url.path(), container->path())) return nullptr;
    return *record;
}

void RoApplicationWorkspace::enumerateApplicationsOfType(unsigned /*type*/, const Block& /*block*/) const {}

}  // namespace cindral
