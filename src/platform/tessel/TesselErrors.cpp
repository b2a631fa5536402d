#include "platform/tessel/TesselErrors.h"

#include <utility>

namespace cindral {
namespace {

struct Collision final : KsErrorAttachment {
    explicit Collision(std::shared_ptr<const TesselItem> inTheWay) : item(std::move(inTheWay)) {}
    const std::shared_ptr<const TesselItem> item;
};

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

bool isExpiredPage(const KsError& error) {
    return error.is(kTesselErrorDomain, static_cast<std::int64_t>(TesselErrorCode::pageExpired));
}

KsError tesselErrorForCollisionWithItem(std::shared_ptr<const TesselItem> item) {
    KsError::UserInfo info{{"message", "An item with that name already exists"}};
    if (const KsURL* url = item->fileURL()) info.emplace("path", url->path());
    return error(TesselErrorCode::filenameCollision, std::move(info))
        .withAttachment(std::make_shared<const Collision>(std::move(item)));
}

std::shared_ptr<const TesselItem> collidingItem(const KsError& error) {
    const auto* collision = dynamic_cast<const Collision*>(error.attachment());
    return collision != nullptr ? collision->item : nullptr;
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
