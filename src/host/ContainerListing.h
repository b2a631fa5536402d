#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "host/ProviderAccess.h"

namespace cindral {

/// The items of a container one after the other, a page at a time.
///
/// The root container lists the children of every root; what a person sees at the top is what has the root as parent.
///
/// Where the provider says that a page has expired, because something was deleted meanwhile, the listing begins again
/// and leaves out what it has given before: each item comes once. Costs the memory of a page, and eight bytes an item.
///
/// Thread safety: for one thread at a time.
class ContainerListing {
public:
    /// Times that a listing begins again without having found anything new, before it gives up.
    static constexpr int kFruitlessRestartsMax = 20;

    /// `client` is borrowed for life.
    ContainerListing(ProviderAccess& client, TesselItemIdentifier container);

    const TesselItemIdentifier& container() const { return container_; }
    /// The next item; null at the end.
    Result<std::shared_ptr<const TesselItem>> next();

private:
    Result<void> readPage();
    Result<void> restart(const KsError& expired);
    bool belongsHere(const TesselItem& item) const;
    bool isNew(const TesselItem& item) const;

    ProviderAccess& client_;
    const TesselItemIdentifier container_;
    std::optional<TesselPage> nextPage_;
    TesselItems items_;
    std::size_t position_ = 0;

    // Hashes of the identifiers given so far; the sorted part is looked into after a restart.
    std::vector<std::uint64_t> given_;
    std::size_t sortedCount_ = 0;
    int fruitlessRestarts_ = 0;
};

}  // namespace cindral
