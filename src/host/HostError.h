#pragma once

#include <string>

#include "platform/foundation/KsError.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// What keeps the host itself from working. The code is the program's exit status.
inline constexpr std::string_view kCindralHostErrorDomain = "CindralHostErrorDomain";

inline constexpr int kExitDone = 0;
inline constexpr int kExitFailed = 1;
inline constexpr int kExitUsage = 2;

/// The operation failed; the message is a line for people.
KsError hostFailure(std::string message);
/// The call's words are off.
KsError usageFailure(std::string message);

int exitStatusOf(const KsError& error);

/// Whether the error says: there is nothing of that name.
bool isNoSuchItem(const KsError& error);

/// What an error means, for people: the domain's own text, or what the host interface says of its codes.
std::string messageOf(const KsError& error);

}  // namespace cindral
