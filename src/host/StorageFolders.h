#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "host/HostEnvironment.h"
#include "host/PresentedPaths.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// The folders that the host works in, before anything is opened: found, checked and made.
///
/// Errors are the host's own, with a line for people.
namespace storage_folders {

/// Refuses a state folder that is the storage or below it, whatever links lead there. Nothing is made. Usage failure.
Result<void> checkApart(const std::string& storage, const std::string& state);

/// Makes the folder and what leads to it where it is missing. Answers the real path.
Result<std::string> makeStorage(const std::string& path);
/// The same, for its owner alone; refuses one that anybody may write to.
Result<std::string> makeState(const std::string& path);

/// The paths of the storage: as it is where that is presentable, else through a link, which is made or pointed to it.
///
/// The link is STATE/Documents; where the state's own path holds a component of that name, it is in a folder of the
/// state's own in the runtime folder or, failing that, in /tmp, for its owner alone. To be called by who holds the
/// state's lock.
Result<PresentedPaths> present(const std::string& given, const std::string& real, const std::string& realState,
                               const HostEnvironment& environment);

/// A folder that is the caller's and nobody else may enter, made where it is missing. POSIX errors; EPERM where it is
/// somebody's else.
Result<void> makePrivateFolder(const std::string& path);
/// A short name for a state folder, the same each time.
std::uint64_t fingerprint(std::string_view text);
/// Points the link to the target, in one step, in place of whatever file was there. POSIX errors.
Result<void> replaceLink(const std::string& link, const std::string& target);
/// None for what is no link.
std::optional<std::string> targetOf(const std::string& link);

}  // namespace storage_folders

}  // namespace cindral
