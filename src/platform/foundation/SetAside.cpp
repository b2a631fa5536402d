#include "platform/foundation/SetAside.h"

#include <fcntl.h>
#include <fmt/chrono.h>
#include <sys/stat.h>

#include <cerrno>
#include <ctime>

#include "platform/foundation/SysEdits.h"

namespace cindral {

Result<std::string> setAside(const std::string& path) {
    const std::string stem = fmt::format("{}.set-aside-{:%Y%m%dT%H%M%S}", path, fmt::gmtime(std::time(nullptr)));
    std::string aside = stem;
    // A second time within the second.
    for (int i = 2;; ++i) {
        const Result<void> renamed = sys::renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, aside.c_str(), RENAME_NOREPLACE);
        if (renamed.ok()) return aside;
        if (!renamed.error().isPosix(EEXIST)) return renamed.error();
        aside = fmt::format("{}-{}", stem, i);
    }
}

Result<std::optional<std::string>> setAsideUnless(const std::string& path, ExpectedKind kind) {
    struct stat there {};
    if (::lstat(path.c_str(), &there) != 0) {
        if (errno == ENOENT || errno == ENOTDIR) return std::optional<std::string>();
        return KsError::posix(errno, path);
    }
    struct stat target {};
    const bool isExpected = kind == ExpectedKind::file ? S_ISREG(there.st_mode)
                                                       : ::stat(path.c_str(), &target) == 0 && S_ISDIR(target.st_mode);
    if (isExpected) return std::optional<std::string>();
    return std::optional(TRY(setAside(path)));
}

}  // namespace cindral
