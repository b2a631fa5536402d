#pragma once

#include <string_view>

namespace cindral {

/// "0.1.0": the version that the build was configured with.
std::string_view hostVersion();

}  // namespace cindral
