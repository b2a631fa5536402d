#include "host/search/SearchFollower.h"

#include <cerrno>
#include <utility>

#include "host/HostError.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/TrashName.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

constexpr std::size_t kContainersAtOnceMax = 20'000;

}  // namespace

/// The listings of some containers, on their way into the store.
class SearchFollower::Listing {
public:
    Listing(SearchFollower& follower, SearchStore& store) : follower_(follower), store_(store) {}

    Result<void> list(const TesselItemIdentifier& container) {
        std::optional<TesselPage> page = tesselInitialPageForFollowers();
        while (page) {
            TRY(follower_.checkStopped());
            Result<ItemsPage> listed = follower_.client_.itemsOnPage(container, *page);
            if (!listed.ok() && isExpiredPage(listed.error())) {
                // What was listed stays; that it comes twice does no harm.
                page = tesselInitialPageForFollowers();
                continue;
            }
            if (!listed.ok()) {
                // It is gone, which the changes tell; or it can't be read, and then nothing in it can be found.
                logDebug("can't list {} for the search index; {}", container, listed.error().description());
                if (listed.error().isPosix(ECANCELED)) return listed.error();
                break;
            }
            // What is kept of an item is a fraction of it.
            for (const auto& item : listed->items) items_.push_back(IndexedItem::of(*item));
            page = std::move(listed->nextPage);
            if (items_.size() >= itemsAtOnce_) TRY(put());
        }
        addTrash(container);
        listed_.push_back(container);
        return {};
    }

    Result<void> put() {
        TRY(store_.putListed(items_, listed_, more_));
        items_.clear();
        listed_.clear();
        more_.clear();
        itemsAtOnce_ = store_.itemsAtOnce();
        return {};
    }

private:
    /// The working set holds what is in the trash, without the folder that it is in.
    void addTrash(const TesselItemIdentifier& container) {
        TesselExtension& provider = follower_.client_.provider();
        const auto url = provider.URLForItemWithPersistentIdentifier(container);
        if (!url || url->lastPathComponent() == kTrashName) return;
        if (auto trash = provider.persistentIdentifierForItemAtURL(url->appendingPathComponent(kTrashName)))
            more_.push_back(*std::move(trash));
    }

    SearchFollower& follower_;
    SearchStore& store_;
    std::size_t itemsAtOnce_ = store_.itemsAtOnce();
    std::vector<IndexedItem> items_;
    std::vector<TesselItemIdentifier> listed_;
    std::vector<TesselItemIdentifier> more_;
};

Result<void> SearchFollower::checkStopped() const {
    return isStopped_ ? Result<void>(KsError::posix(ECANCELED)) : Result<void>();
}

Result<void> SearchFollower::beginGather(SearchStore& store) {
    const auto anchor = TRY(client_.anchor(kTesselWorkingSetContainerItemIdentifier));
    if (!anchor) return hostFailure("the provider gives no anchor of the working set");
    logInfo("gathering the search index");
    return store.beginGather(*anchor, std::span(&kTesselRootContainerItemIdentifier, 1));
}

Result<void> SearchFollower::listAll(SearchStore& store) {
    Listing listing(*this, store);
    while (true) {
        const auto containers = TRY(store.unlisted(kContainersAtOnceMax));
        if (containers.empty()) return {};
        for (const auto& container : containers) TRY(listing.list(container));
        TRY(listing.put());
    }
}

/// Applies one batch of changes. Whether there are more.
Result<bool> SearchFollower::followOnce(SearchStore& store) {
    const SearchStore::Position position = TRY(store.position());
    const ChangesBatch batch = TRY(
        client_.changesSince(kTesselWorkingSetContainerItemIdentifier, position.anchor.value_or(TesselSyncAnchor())));
    if (!batch.log.empty() || batch.anchor != position.anchor) TRY(store.apply(batch));
    return batch.moreComing;
}

/// A domain that was to be forgotten while others followed the changes may have come back in between, which then nobody
/// tells any more.
Result<void> SearchFollower::confirmForgotten(SearchStore& store) {
    const auto domains = TRY(store.forgottenDomains());
    if (domains.empty()) return {};
    for (const std::string& domain : domains) {
        if (client_.provider().itemForIdentifier("#" + domain).ok()) return beginGather(store);
    }
    return store.confirmDomains();
}

Result<void> SearchFollower::catchUp(SearchStore& store, bool& gathered) {
    gathered = false;
    while (true) {
        TRY(checkStopped());
        SearchStore::Position position = TRY(store.position());
        if (!position.anchor) TRY(beginGather(store));
        const bool isGathering = position.isGathering || !position.anchor;
        if (isGathering) {
            gathered = true;
            TRY(listAll(store));
        }
        Result<bool> more = followOnce(store);
        while (more.ok() && *more) {
            TRY(checkStopped());
            more = followOnce(store);
        }
        if (!more.ok() && isExpiredPage(more.error())) {
            TRY(beginGather(store));
            continue;
        }
        if (!more.ok()) return more.error();
        if (isGathering) {
            // Folders that came along with the changes.
            if (!TRY(store.unlisted(1)).empty()) continue;
            TRY(store.endGather());
            const auto counts = store.counts();
            logInfo("the search index holds {} items", counts.ok() ? counts->items : 0);
        }
        TRY(confirmForgotten(store));
        if (!TRY(store.position()).isGathering) return {};
    }
}

}  // namespace cindral
