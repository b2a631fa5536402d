#include "provider/LocalThumbnails.h"

#include <new>
#include <utility>

#include "platform/foundation/Log.h"
#include "provider/Utilities.h"

namespace cindral {
namespace {

constexpr int kLargeVariant = 32;
constexpr int kTabletVariant = 24;
constexpr int kPhoneVariant = 15;

int variantFor(bool isTablet, double scale) {
    if (scale == 3.0) return kLargeVariant;
    if (scale == 2.0) return isTablet ? kTabletVariant : kPhoneVariant;
    return isTablet ? 1 : 0;
}

}  // namespace

std::optional<IconData> bestIconData(const RoApplicationProxy& application, bool isTablet, double scale) {
    for (; scale >= 1.0; scale -= 1.0) {
        if (auto data = application.iconDataForVariant(variantFor(isTablet, scale))) return data;
    }
    return std::nullopt;
}

std::optional<IconData> bestIconData(const RoApplicationProxy& application) {
    return bestIconData(application, isTabletDevice(), mainScreenScale());
}

std::optional<Bytes> thumbnailForItemIdentifier(const TesselItemIdentifier& identifier, const ThumbnailTools& tools) {
    if (!identifier.starts_with('#')) return std::nullopt;
    const std::string bundleIdentifier = identifier.substr(1);
    const auto application = RoApplicationProxy::applicationProxyForIdentifier(bundleIdentifier);
    if (!application) {
        logDebug("{}: can't get app proxy for {}", identifier, bundleIdentifier);
        return std::nullopt;
    }
    const auto icon = bestIconData(*application);
    if (!icon) {
        logDebug("{}: can't get primary icon data; there is none that is large enough", identifier);
        return std::nullopt;
    }
    Result<IconImage> image = tools.image(*icon);
    if (!image.ok()) {
        logDebug("{}: can't create icon from cached bitmap", identifier);
        return std::nullopt;
    }
    const std::unique_ptr<Bytes> data = tools.newData();
    if (!data) {
        logError("{}: can't create new data", identifier);
        return std::nullopt;
    }
    const std::unique_ptr<ImageDestination> destination = tools.newDestination(*data);
    if (!destination) {
        logError("{}: can't create image from new data", identifier);
        return std::nullopt;
    }
    destination->addImage(*std::move(image));
    if (!destination->finalize()) {
        logError("{}: can't finalize image", identifier);
        return std::nullopt;
    }
    return std::move(*data);
}

}  // namespace cindral
