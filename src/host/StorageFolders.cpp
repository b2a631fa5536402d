#include "host/StorageFolders.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>

#include "host/HostError.h"
#include "host/TerminalText.h"

namespace cindral::storage_folders {
namespace {

constexpr mode_t kOwnerOnly = 0700;
constexpr mode_t kAsTheUmaskSays = 0777;
constexpr std::string_view kLinkName = "Documents";

KsError failure(std::string_view what, const std::string& path, const KsError& error) {
    return hostFailure(fmt::format("{} {}: {}", what, terminalText(path), error.reason()));
}

/// With the links of the part that exists resolved.
std::string resolvedAsFarAsItExists(const std::string& path) {
    std::error_code error;
    const std::string resolved = std::filesystem::weakly_canonical(path, error).string();
    return error ? tidyPath(path) : tidyPath(resolved);
}

Result<void> makeFolders(const std::string& path, mode_t mode) {
    for (std::size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
        if (::mkdir(path.substr(0, slash).c_str(), mode) != 0 && errno != EEXIST) {
            // One on the way that exists may refuse in other ways (EROFS, EACCES); what counts is whether the end is
            // there.
            const int reason = errno;
            struct stat status {};
            if (::stat(path.substr(0, slash).c_str(), &status) != 0) return KsError::posix(reason);
        }
        if (slash == std::string::npos) return {};
    }
}

Result<std::string> realFolder(const std::string& path) {
    const std::unique_ptr<char, decltype(&std::free)> real(::realpath(path.c_str(), nullptr), &std::free);
    if (!real) return KsError::errorWithPOSIXCode();
    struct stat status {};
    if (::stat(real.get(), &status) != 0) return KsError::errorWithPOSIXCode();
    if (!S_ISDIR(status.st_mode)) return KsError::posix(ENOTDIR);
    return std::string(real.get());
}

Result<std::string> makeFolder(std::string_view what, const std::string& path, mode_t mode) {
    if (auto made = makeFolders(path, mode); !made.ok())
        return failure(fmt::format("can't make {}", what), path, made.error());
    auto real = realFolder(path);
    if (!real.ok()) return failure(fmt::format("can't use {}", what), path, real.error());
    return real;
}

/// The folder that the link is to be in.
Result<std::string> linkFolder(const std::string& realState, const HostEnvironment& environment) {
    if (!PresentedPaths::hasDocumentsComponent(realState)) return realState;

    const std::string name = fmt::format("cindral-{:016x}", fingerprint(realState));
    const std::string& runtime = environment.runtimeFolder;
    if (!runtime.empty() && !PresentedPaths::hasDocumentsComponent(runtime)) {
        const std::string folder = runtime + "/" + name;
        if (makePrivateFolder(folder).ok()) return folder;
    }
    const std::string folder = fmt::format("/tmp/{}-{}", name, ::geteuid());
    if (auto made = makePrivateFolder(folder); !made.ok()) return failure("can't use the folder", folder, made.error());
    return folder;
}

/// Points the link to the target, replacing an older link in one step.
Result<void> pointLink(const std::string& link, const std::string& target) {
    if (targetOf(link) == target) return {};
    struct stat status {};
    if (::lstat(link.c_str(), &status) == 0 && !S_ISLNK(status.st_mode)) {
        return hostFailure(fmt::format("{} is in the way: the link to the storage is to be there", terminalText(link)));
    }
    if (auto made = replaceLink(link, target); !made.ok()) return failure("can't make the link", link, made.error());
    return {};
}

}  // namespace

Result<void> makePrivateFolder(const std::string& path) {
    if (::mkdir(path.c_str(), kOwnerOnly) != 0 && errno != EEXIST) return KsError::errorWithPOSIXCode();
    struct stat status {};
    // Not through a link: in a folder that all may write to, somebody else may have been first.
    if (::lstat(path.c_str(), &status) != 0) return KsError::errorWithPOSIXCode();
    const bool isPrivate = S_ISDIR(status.st_mode) && status.st_uid == ::geteuid() && (status.st_mode & 0077) == 0;
    return isPrivate ? Result<void>() : Result<void>(KsError::posix(EPERM));
}

std::uint64_t fingerprint(std::string_view text) {
    std::uint64_t hash = 14'695'981'039'346'656'037U;  // FNV-1a.
    for (const char c : text) hash = (hash ^ static_cast<std::uint8_t>(c)) * 1'099'511'628'211U;
    return hash;
}

std::optional<std::string> targetOf(const std::string& link) {
    std::error_code error;
    const std::string target = std::filesystem::read_symlink(link, error).string();
    return error ? std::nullopt : std::optional(target);
}

Result<void> replaceLink(const std::string& link, const std::string& target) {
    if (targetOf(link) == target) return {};
    const std::string temporary = link + ".new";
    ::unlink(temporary.c_str());
    if (::symlink(target.c_str(), temporary.c_str()) == 0 && ::rename(temporary.c_str(), link.c_str()) == 0) return {};
    return KsError::errorWithPOSIXCode();
}

Result<void> checkApart(const std::string& storage, const std::string& state) {
    if (!PresentedPaths::remainder(resolvedAsFarAsItExists(state), resolvedAsFarAsItExists(storage))) return {};
    return usageFailure(
        fmt::format("the state folder {} is inside the storage {}", terminalText(state), terminalText(storage)));
}

Result<std::string> makeStorage(const std::string& path) {
    return makeFolder("the storage", path, kAsTheUmaskSays);
}

Result<std::string> makeState(const std::string& path) {
    std::string real = TRY(makeFolder("the state folder", path, kOwnerOnly));
    struct stat status {};
    if (::stat(real.c_str(), &status) != 0)
        return failure("can't use the state folder", path, KsError::errorWithPOSIXCode());
    // What lies in it says where the storage is and what its items are called: nobody else may put it there.
    if ((status.st_mode & S_IWOTH) != 0)
        return hostFailure(fmt::format("the state folder {} may be written to by anybody", terminalText(path)));
    return real;
}

Result<PresentedPaths> present(const std::string& given, const std::string& real, const std::string& realState,
                               const HostEnvironment& environment) {
    if (PresentedPaths::isPresentable(real)) return PresentedPaths(given, real, real);
    const std::string link = TRY(linkFolder(realState, environment)).append("/").append(kLinkName);
    TRY(pointLink(link, real));
    return PresentedPaths(given, real, link);
}

}  // namespace cindral::storage_folders
