#include "platform/tessel/TesselErrors.h"

#include <utility>

namespace cindral {
namespace {

KsError error(TesselErrorCode code, KsError::UserInfo info) {
    return {kTesselErrorDomain, static_cast<std::int64_t>(code), std::move(info)};
}

KsError error(TSErrorCode code, KsError::UserInfo info) {
    return {kTSErrorDomain, static_cast<std::int64_t>(code), std::move(info)};
}

}  // namespace

KsError tesselErrorForNonExistentItemWithIdentifier(const TesselItemIdentifier& identifier) {
    return error(TesselErrorCode::noSuchItem, {{"message", "No such item"}, {"identifier", identifier}});
}

KsError tesselErrorForExpiredPage() {
    return error(TesselErrorCode::pageExpired, {{"message", "The page or sync anchor has expired"}});
}

KsError tesselErrorForCollisionAtPath(std::string path) {
    return error(TesselErrorCode::filenameCollision,
                 {{"message", "An item with that name already exists"}, {"path", std::move(path)}});
}

KsError tsInvalidParameterError(std::string parameter, std::string value) {
    return error(
        TSErrorCode::invalidParameter,
        {{"message", "A parameter is invalid"}, {"parameter", std::move(parameter)}, {"value", std::move(value)}});
}

KsError tsItemNotFoundError(const TesselItemIdentifier& identifier) {
    return error(TSErrorCode::itemNotFound, {{"message", "The item was not found"}, {"identifier", identifier}});
}

}  // namespace cindral
