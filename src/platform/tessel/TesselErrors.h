#pragma once

#include <memory>

#include "platform/foundation/KsError.h"
#include "platform/tessel/TesselItem.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

inline constexpr std::string_view kTesselErrorDomain = "TesselErrorDomain";
inline constexpr std::string_view kTSErrorDomain = "TSErrorDomain";

/// Codes of TesselErrorDomain. Part of the host interface: add numbers, never change one.
enum class TesselErrorCode : std::int64_t {
    noSuchItem = -1001,
    pageExpired = -1002,  ///< and syncAnchorExpired: one number for both
    filenameCollision = -1003,
};
/// Codes of TSErrorDomain. Part of the host interface: add numbers, never change one.
enum class TSErrorCode : std::int64_t { invalidParameter = 1, itemNotFound = 2 };

/// "identifier" in the user info names the item.
KsError tesselErrorForNonExistentItemWithIdentifier(const TesselItemIdentifier& identifier);
/// A page or sync anchor that can't be resumed: the host lists anew.
KsError tesselErrorForExpiredPage();
bool isExpiredPage(const KsError& error);
/// Holds the item in the way: collidingItem(). "path" in the user info is its path where it has one.
KsError tesselErrorForCollisionWithItem(std::shared_ptr<const TesselItem> item);
/// The item in the way, of an error that a name collides; null for any other.
std::shared_ptr<const TesselItem> collidingItem(const KsError& error);
/// "parameter" and "value" in the user info.
KsError tsInvalidParameterError(std::string parameter, std::string value);
KsError tsItemNotFoundError(const TesselItemIdentifier& identifier);

}  // namespace cindral
