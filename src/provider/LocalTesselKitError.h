#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/KsError.h"

namespace cindral {

inline constexpr std::string_view kLocalTesselKitErrorDomain = "CindralProvider.LocalTesselKitError";

/// The provider's own errors. The ordinal is the code that the host sees: add cases at the end, never move one.
enum class LocalTesselKitError : std::int64_t {
    invalidItemIdentifier,
    invalidItemURL,
    itemNotFound,
    unableToGetDeviceUUID
};

KsError errorFor(LocalTesselKitError error);

}  // namespace cindral
