#include "host/ContainerListing.h"

#include <algorithm>

#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

std::uint64_t hashOf(const TesselItem& item) {
    return std::hash<std::string>{}(item.itemIdentifier());
}

}  // namespace

ContainerListing::ContainerListing(ProviderAccess& client, TesselItemIdentifier container)
    : client_(client), container_(std::move(container)), nextPage_(tesselInitialPageSortedByName()) {}

Result<std::shared_ptr<const TesselItem>> ContainerListing::next() {
    while (true) {
        while (position_ < items_.size()) {
            std::shared_ptr<const TesselItem> item = std::move(items_[position_++]);
            if (!belongsHere(*item) || !isNew(*item)) continue;
            given_.push_back(hashOf(*item));
            fruitlessRestarts_ = 0;
            return item;
        }
        if (!nextPage_) return std::shared_ptr<const TesselItem>();
        TRY(readPage());
    }
}

Result<void> ContainerListing::readPage() {
    auto page = client_.itemsOnPage(container_, *nextPage_);
    if (!page.ok()) return isExpiredPage(page.error()) ? restart(page.error()) : Result<void>(page.error());
    items_ = std::move(page->items);
    nextPage_ = std::move(page->nextPage);
    position_ = 0;
    return {};
}

Result<void> ContainerListing::restart(const KsError& expired) {
    if (++fruitlessRestarts_ > kFruitlessRestartsMax) return expired;
    nextPage_ = tesselInitialPageSortedByName();
    std::ranges::sort(given_);
    sortedCount_ = given_.size();
    return {};
}

bool ContainerListing::belongsHere(const TesselItem& item) const {
    return container_ != kTesselRootContainerItemIdentifier ||
           item.parentItemIdentifier() == kTesselRootContainerItemIdentifier;
}

bool ContainerListing::isNew(const TesselItem& item) const {
    return !std::binary_search(given_.begin(), given_.begin() + static_cast<std::ptrdiff_t>(sortedCount_),
                               hashOf(item));
}

}  // namespace cindral
