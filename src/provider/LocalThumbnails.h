#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "platform/imaging/IconImage.h"
#include "platform/imaging/ImageDestination.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

/// The icon of an application that suits this device best, or none: what the screen's scale asks for, else what a coarser
/// screen would.
std::optional<IconData> bestIconData(const RoApplicationProxy& application);
/// The same for any device. None for a scale below 1.
std::optional<IconData> bestIconData(const RoApplicationProxy& application, bool isTablet, double scale);

/// What a thumbnail is made with. For tests, others.
struct ThumbnailTools {
    std::function<Result<IconImage>(const IconData&)> image = [](const IconData& icon) {
        return iconImageFromData(icon.bytes, icon.pixels);
    };
    std::function<std::unique_ptr<Bytes>()> newData = [] { return std::unique_ptr<Bytes>(new (std::nothrow) Bytes); };
    std::function<std::unique_ptr<ImageDestination>(Bytes&)> newDestination = [](Bytes& data) {
        return ImageDestination::create(data, kPngTypeIdentifier, 1);
    };
};

/// A PNG file: the icon of the application whose app library the identifier names. None for every other item, and, after
/// a log line, where there is no icon or it is no image.
std::optional<Bytes> thumbnailForItemIdentifier(const TesselItemIdentifier& identifier,
                                                const ThumbnailTools& tools = {});

}  // namespace cindral
