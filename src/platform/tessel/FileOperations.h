#pragma once

#include <cstdint>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// Bytes of the regular files in a directory and below it. Links are not followed and other devices not entered; what
/// can't be read counts as nothing. POSIX error when the directory itself can't be opened.
Result<std::uint64_t> ts_directorySize(const KsURL& directory);  // NOLINT(readability-identifier-naming)

}  // namespace cindral
