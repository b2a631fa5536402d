#include "provider/Utilities.h"

#include <cerrno>
#include <cstdlib>
#include <string>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SysEdits.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {

namespace {

constexpr std::string_view kVar = "/var";
constexpr std::string_view kPrivateVar = "/private/var";
constexpr double kDefaultScreenScale = 2.0;
constexpr std::string_view kTabletDeviceClass = "3";

/// Unprivileged processes may keep attributes in this namespace alone.
std::string inUserNamespace(std::string_view name) {
    std::string full = "user.";
    full += name;
    return full;
}

void logXattrFailure(std::string_view what, std::string_view name, const KsError& error) {
    if (error.isPosix(ENOENT)) {
        logDebug("{} {}; {}", what, name, error.description());
    } else {
        logError("{} {}; {}", what, name, error.description());
    }
}

std::optional<KsError> xattrWriteFailure(std::string_view verb, std::string_view name, const KsError& error) {
    if (error.isPosix(EACCES)) {
        logDebug("can't {} xattr \"{}\"; {}", verb, name, error.description());
    } else {
        logError("can't {} xattr \"{}\"; {}", verb, name, error.description());
    }
    return error;
}

template <typename T>
std::optional<T> typedResourceValue(const KsURL& url, ResourceKey key) {
    Result<std::optional<ResourceValue>> value = url.resourceValue(key);
    if (!value.ok()) {
        logError("can't get resource \"{}\" for \"{}\"; {}", resourceKeyName(key), url.description(),
                 value.error().description());
        return std::nullopt;
    }
    if (!*value) return std::nullopt;
    T* typed = std::get_if<T>(&**value);
    return typed != nullptr ? std::optional<T>(std::move(*typed)) : std::nullopt;
}

}  // namespace

std::string_view properPath(std::string_view path, std::string& out) {
    if (!path.starts_with(kVar)) return path;
    out = kPrivateVar;
    out += path.substr(kVar.size());
    return out;
}

KsURL properURL(const KsURL& url) {
    if (!url.isFileURL() || !url.path().starts_with(kVar)) return url;
    std::string path;
    properPath(url.path(), path);
    return KsURL::fileURL(std::move(path));
}

std::optional<Bytes> initWithValueOfXattr(std::string_view name, const KsURL& url) {
    const std::string full = inUserNamespace(name);
    if (!url.mayHaveAttribute(full)) return std::nullopt;
    const Result<std::size_t> size = url.attribute(full.c_str(), {});
    if (!size.ok()) {
        // A file system without attributes has none.
        if (size.error().isPosix(ENODATA) || size.error().isPosix(ENOTSUP)) return std::nullopt;
        logXattrFailure("can't get xattr", name, size.error());
        return std::nullopt;
    }
    Bytes value(*size);
    if (value.empty()) return value;
    const Result<std::size_t> read = url.attribute(full.c_str(), value);
    if (!read.ok()) {
        logXattrFailure("can't copy data for xattr", name, read.error());
        return std::nullopt;
    }
    value.resize(*read);
    return value;
}

std::optional<KsError> setXattr(int fd, const std::optional<Bytes>& value, std::string_view name) {
    const std::string full = inUserNamespace(name);
    if (value) {
        const Result<void> set = sys::fsetxattr(fd, full.c_str(), *value);
        return set.ok() ? std::nullopt : xattrWriteFailure("set", name, set.error());
    }
    const Result<void> removed = sys::fremovexattr(fd, full.c_str());
    if (removed.ok() || removed.error().isPosix(ENODATA)) return std::nullopt;
    return xattrWriteFailure("remove", name, removed.error());
}

std::optional<bool> boolResourceValue(const KsURL& url, ResourceKey key) {
    return typedResourceValue<bool>(url, key);
}
std::optional<KsDate> dateResourceValue(const KsURL& url, ResourceKey key) {
    return typedResourceValue<KsDate>(url, key);
}
std::optional<std::string> stringResourceValue(const KsURL& url, ResourceKey key) {
    return typedResourceValue<std::string>(url, key);
}
std::optional<std::uint64_t> numberResourceValue(const KsURL& url, ResourceKey key) {
    return typedResourceValue<std::uint64_t>(url, key);
}

std::uint64_t checkedSum(std::uint64_t a, std::uint64_t b) {
    std::uint64_t sum = 0;
    if (__builtin_add_overflow(a, b, &sum)) fatal("a count overflows");
    return sum;
}

bool isInTrash(const KsURL& url) {
    static constexpr std::string_view kTrash = "/.Trash";
    const std::string& path = url.path();
    // Most paths hold no such text at all: the root is looked for only when one does.
    std::size_t at = path.find(kTrash);
    if (at == std::string::npos) return false;
    const auto root = RootDirectories::shared().rootHolding(path);
    for (; at != std::string::npos; at = path.find(kTrash, at + 1)) {
        const std::size_t end = at + kTrash.size();
        const bool wholeComponent = end == path.size() || path[end] == '/';
        if (wholeComponent && (!root || at >= root->path.size())) return true;
    }
    return false;
}

bool isTabletDevice() {
    static const bool tablet = [] {
        const char* deviceClass = std::getenv("CINDRAL_DEVICE_CLASS");
        return deviceClass != nullptr && deviceClass == kTabletDeviceClass;
    }();
    return tablet;
}

double mainScreenScale() {
    static const double scale = [] {
        const char* text = std::getenv("CINDRAL_SCREEN_SCALE");
        const double asked = text != nullptr ? std::strtod(text, nullptr) : 0;
        return asked > 0 && asked <= 16 ? asked : kDefaultScreenScale;
    }();
    return scale;
}

KsURL temporaryLocalFolderURL() {
    const KsURL storage = TesselManager::defaultManager().documentStorageURL();
    KsURL folder = storage.appendingPathComponent(kTemporaryLocalFolderName);
    const Result<void> made = file_operations::makeFolderUnlessThere(folder);
    if (!made.ok()) logError("can't create temporary directory; {}", made.error().description());
    return folder;
}

}  // namespace cindral
