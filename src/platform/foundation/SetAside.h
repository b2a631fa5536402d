#pragma once

#include <optional>
#include <string>

#include "platform/foundation/Result.h"

namespace cindral {

/// Renames what is at the path beside itself, to ".set-aside-" and the time behind its name. Answers the new path, which
/// nothing had before.
Result<std::string> setAside(const std::string& path);

enum class ExpectedKind { file, folder };
/// Sets aside what is at the path and of another kind. None where there is nothing, or what is expected. A folder may
/// also be a link to one; a file is never a link.
Result<std::optional<std::string>> setAsideUnless(const std::string& path, ExpectedKind kind);

}  // namespace cindral
