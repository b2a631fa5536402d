#pragma once

#include <string_view>

namespace cindral {

/// Ends a wrong program: writes the message as an error line, then aborts.
[[noreturn]] void fatal(std::string_view message);

}  // namespace cindral
