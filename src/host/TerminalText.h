#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/foundation/KsDate.h"

namespace cindral {

/// A name as a terminal may show it, on one line.
///
/// Control characters, characters that turn the direction of what follows, and bytes that are not UTF-8 become \xNN,
/// and a backslash becomes two: no name can move the cursor, colour the screen or look like another one that is
/// escaped.
std::string terminalText(std::string_view text);
void appendTerminalText(std::string& out, std::string_view text);

/// "1 folder", "2 folders".
std::string counted(std::uint64_t count, std::string_view one, std::string_view many);
/// "0 B", "999 B", "1.2 MB", "340 GB": powers of 1,000, one decimal below ten. At most six characters up to exabytes.
std::string humanSize(std::uint64_t bytes);

/// "2026-11-20 09:52", in local time.
std::string humanMinute(const KsDate& date);
/// "2026-11-20 09:52:07 +0100", in local time.
std::string humanMoment(const KsDate& date);

}  // namespace cindral
