#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/roster/KeyFile.h"

namespace cindral {

/// Reading what describes applications: small files of which nothing is taken on trust.
///
/// `directory` is an open folder or AT_FDCWD. None, without a log line, for what is not there or can't be read.
///
/// Thread safety: functions without state.
namespace roster_files {

/// How links are followed on the way to a file.
enum class Links { anywhere, beneath };

/// An open folder, a handle only.
std::optional<UniqueFd> openFolder(int directory, const std::string& path, Links links);
/// Of a regular file with at most `max` bytes. Anything else is never opened.
std::optional<Bytes> read(int directory, const std::string& path, std::size_t max, Links links);
std::optional<KeyFile> readKeyFile(int directory, const std::string& path, Links links);
/// The names in the open folder, in the order of their bytes, without those that begin with ".".
std::vector<std::string> names(int directory);

}  // namespace roster_files

/// The steps of an absolute path, from the top: each folder, and the name in it that leads on.
struct PathStep {
    std::string folder;
    std::string name;
};
std::vector<PathStep> stepsOf(std::string_view path);

}  // namespace cindral
