#include "host/ProviderClient.h"

#include <atomic>
#include <cerrno>

#include "host/Awaited.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {
namespace {

bool isKept(const TesselItemIdentifier& container) {
    return container == kTesselRootContainerItemIdentifier || container == kTesselWorkingSetContainerItemIdentifier ||
           container == kTesselAllDirectoriesContainerItemIdentifier;
}

// Times that changes are asked for when the enumeration is cut short, or the container is elsewhere at its end.
constexpr int kAttemptsMax = 5;

/// Collects a page, and answers once. One that is dropped without an end answers with ECANCELED.
class PageCollector final : public TesselEnumerationObserver {
public:
    explicit PageCollector(ProviderClient::PageCompletion completion) : completion_(std::move(completion)) {}
    ~PageCollector() override { finish(KsError::posix(ECANCELED)); }

    void didEnumerateItems(TesselItems items) override {
        if (page_.items.empty()) {
            page_.items = std::move(items);
        } else {
            page_.items.insert(page_.items.end(), std::make_move_iterator(items.begin()),
                               std::make_move_iterator(items.end()));
        }
    }
    void finishEnumeratingUpToPage(std::optional<TesselPage> nextPage) override {
        page_.nextPage = std::move(nextPage);
        finish(std::move(page_));
    }
    void finishEnumeratingWithError(const KsError& error) override { finish(error); }

private:
    void finish(Result<ItemsPage> result) {
        if (auto completion = std::exchange(completion_, nullptr)) completion(std::move(result));
    }

    ProviderClient::PageCompletion completion_;
    ItemsPage page_;
};

/// Collects changes, and answers once. One that is dropped without an end answers with ECANCELED.
class ChangesCollector final : public TesselChangeObserver {
public:
    /// Told whether the provider has brought the enumeration to an end.
    using Completion = std::function<void(Result<ChangesBatch>, bool isEnded)>;
    explicit ChangesCollector(Completion completion) : completion_(std::move(completion)) {}
    ~ChangesCollector() override { finish(KsError::posix(ECANCELED), false); }

    void didUpdateItems(TesselItems items) override {
        for (auto& item : items) {
            TesselItemIdentifier identifier = item->itemIdentifier();
            batch_.log.push_back({std::move(item), std::move(identifier)});
        }
    }
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override {
        for (auto& identifier : identifiers) batch_.log.push_back({nullptr, std::move(identifier)});
    }
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) override {
        batch_.anchor = std::move(anchor);
        batch_.moreComing = moreComing;
        finish(std::move(batch_), true);
    }
    void finishEnumeratingWithError(const KsError& error) override { finish(error, true); }

private:
    void finish(Result<ChangesBatch> result, bool isEnded) {
        if (auto completion = std::exchange(completion_, nullptr)) completion(std::move(result), isEnded);
    }

    Completion completion_;
    ChangesBatch batch_;
};

}  // namespace

/// An enumerator that is invalidated when nobody needs it any more: not here, not on this thread, because that may be
/// within a call of the enumerator's.
class ProviderClient::Handle {
public:
    Handle(std::shared_ptr<TesselEnumerator> enumerator, DispatchGroup& invalidations)
        : enumerator_(std::move(enumerator)), invalidations_(invalidations) {}
    ~Handle() {
        if (!enumerator_) return;
        invalidations_.enter();
        dispatchAsync([enumerator = std::move(enumerator_), &group = invalidations_]() mutable {
            enumerator->invalidate();
            enumerator.reset();
            group.leave();
        });
    }
    Handle(const Handle&) = delete;
    Handle& operator=(const Handle&) = delete;

    TesselEnumerator& enumerator() { return *enumerator_; }
    /// For the last who has the handle, and not within a call of the enumerator's.
    void invalidateNow() {
        enumerator_->invalidate();
        enumerator_.reset();
    }

private:
    std::shared_ptr<TesselEnumerator> enumerator_;
    DispatchGroup& invalidations_;
};

/// An enumerator for the time of one request: until the call has returned and the request is answered, whichever comes
/// later.
class ProviderClient::Use {
public:
    /// The group is left when the call has returned: until then the client is there.
    Use(std::shared_ptr<Handle> handle, DispatchGroup& calls)
        : handle_(std::move(handle)), place_(handle_->enumerator().enumeratedItemURL()), calls_(calls) {
        calls_.enter();
    }

    TesselEnumerator& enumerator() { return handle_->enumerator(); }
    /// Whether the container is no longer where the enumerator looked: it has moved since, or another package has taken
    /// its document over. What was said is of the old place then.
    bool isElsewhere(TesselExtension& provider, const TesselItemIdentifier& container) const {
        return place_ && provider.URLForItemWithPersistentIdentifier(container) != place_;
    }

    void callReturned() {
        if (isLast()) {
            // Mostly the request was answered within the call, and nobody else has the enumerator.
            if (handle_.use_count() == 1) handle_->invalidateNow();
            handle_.reset();
        }
        calls_.leave();
    }
    /// Lets go of the use: once answered, the client and all it holds may be on their way out.
    static void answered(std::shared_ptr<Use>& use) {
        const std::shared_ptr<Use> last = std::move(use);
        if (last->isLast()) last->handle_.reset();
    }

private:
    bool isLast() { return pending_.fetch_sub(1) == 1; }

    std::shared_ptr<Handle> handle_;
    const std::optional<KsURL> place_;
    DispatchGroup& calls_;
    std::atomic<int> pending_ = 2;
};

ProviderClient::~ProviderClient() {
    std::map<TesselItemIdentifier, std::shared_ptr<Handle>> kept;
    {
        const MutexLock lock(mutex_);
        kept.swap(kept_);
        kept.merge(monitored_);
    }
    kept.clear();
    invalidations_.wait();
}

Result<std::shared_ptr<ProviderClient::Handle>> ProviderClient::enumerator(const TesselItemIdentifier& container) {
    return std::make_shared<Handle>(TRY(provider_->enumeratorForContainerItemIdentifier(container)), invalidations_);
}

Result<std::shared_ptr<ProviderClient::Handle>> ProviderClient::anyEnumerator(const TesselItemIdentifier& container) {
    return isKept(container) ? keptEnumerator(container) : enumerator(container);
}

/// What is monitored from now on is where the folder is now, and knows that the client has come: the next change is
/// signalled again.
Result<std::shared_ptr<ProviderClient::Handle>> ProviderClient::comingEnumerator(
    const TesselItemIdentifier& container) {
    auto made = TRY(anyEnumerator(container));
    if (isKept(container)) return made;
    std::shared_ptr<Handle> before;
    {
        const MutexLock lock(mutex_);
        if (const auto monitored = monitored_.find(container); monitored != monitored_.end())
            before = std::exchange(monitored->second, made);
    }
    if (before) made->enumerator().start();
    return made;
}

Result<std::shared_ptr<ProviderClient::Handle>> ProviderClient::keptEnumerator(const TesselItemIdentifier& container) {
    const MutexLock lock(mutex_);
    const auto found = kept_.find(container);
    if (found != kept_.end()) return found->second;
    auto handle = TRY(enumerator(container));
    kept_.emplace(container, handle);
    return handle;
}

Result<void> ProviderClient::startMonitoring(const TesselItemIdentifier& container) {
    std::shared_ptr<Handle> handle = TRY(anyEnumerator(container));
    handle->enumerator().start();
    if (isKept(container)) return {};
    const MutexLock lock(mutex_);
    monitored_[container].swap(handle);
    return {};
}

void ProviderClient::stopMonitoring(const TesselItemIdentifier& container) {
    std::shared_ptr<Handle> handle;
    {
        const MutexLock lock(mutex_);
        if (const auto kept = kept_.find(container); kept != kept_.end()) {
            handle = kept->second;
        } else if (const auto monitored = monitored_.find(container); monitored != monitored_.end()) {
            handle = std::move(monitored->second);
            monitored_.erase(monitored);
        }
    }
    // Others may be using it for a request, which then goes on by itself.
    if (handle) handle->enumerator().stop();
}

void ProviderClient::enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                                      ChangesCompletion completion) {
    enumerateChanges(container, anchor, kAttemptsMax, std::move(completion));
}

void ProviderClient::enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                                      int attempts, ChangesCompletion completion) {
    auto made = comingEnumerator(container);
    if (!made.ok()) {
        completion(std::move(made).error());
        return;
    }
    auto use = std::make_shared<Use>(*std::move(made), invalidations_);
    use->enumerator().enumerateChangesForObserver(
        std::make_shared<ChangesCollector>(
            [=, this, completion = std::move(completion)](Result<ChangesBatch> result, bool isEnded) mutable {
                const bool isElsewhere = result.ok() && use->isElsewhere(*provider_, container);
                Use::answered(use);
                // Whoever stopped the enumeration meant something else: that the container is no longer monitored.
                const bool isCut = isEnded && !result.ok() && result.error().isPosix(ECANCELED);
                if (!isCut && !isElsewhere) return completion(std::move(result));
                if (attempts == 1) return completion(KsError::posix(ECANCELED));
                dispatchAsync([this, container, anchor, attempts, again = std::move(completion)]() mutable {
                    enumerateChanges(container, anchor, attempts - 1, std::move(again));
                });
            }),
        anchor);
    use->callReturned();
}

void ProviderClient::enumerateItems(const TesselItemIdentifier& container, const TesselPage& page,
                                    PageCompletion completion) {
    enumerateItems(container, page, kAttemptsMax, std::move(completion));
}

void ProviderClient::enumerateItems(const TesselItemIdentifier& container, const TesselPage& page, int attempts,
                                    PageCompletion completion) {
    // On the first page the client comes to see what there is; the others go on with that.
    const bool isFirst = page == tesselInitialPageSortedByName() || page == tesselInitialPageSortedByDate();
    auto made = isFirst ? comingEnumerator(container) : anyEnumerator(container);
    if (!made.ok()) {
        completion(std::move(made).error());
        return;
    }
    auto use = std::make_shared<Use>(*std::move(made), invalidations_);
    use->enumerator().enumerateItemsForObserver(
        std::make_shared<PageCollector>(
            [=, this, completion = std::move(completion)](Result<ItemsPage> result) mutable {
                const bool isElsewhere = result.ok() && use->isElsewhere(*provider_, container);
                Use::answered(use);
                if (!isElsewhere) return completion(std::move(result));
                if (attempts == 1) return completion(KsError::posix(ECANCELED));
                dispatchAsync([this, container, page, attempts, again = std::move(completion)]() mutable {
                    enumerateItems(container, page, attempts - 1, std::move(again));
                });
            }),
        page);
    use->callReturned();
}

void ProviderClient::currentSyncAnchor(const TesselItemIdentifier& container, AnchorCompletion completion) {
    auto made = anyEnumerator(container);
    if (!made.ok()) {
        completion(std::move(made).error());
        return;
    }
    auto use = std::make_shared<Use>(*std::move(made), invalidations_);
    use->enumerator().currentSyncAnchorWithCompletionHandler(
        [use, completion = std::move(completion)](std::optional<TesselSyncAnchor> anchor) mutable {
            Use::answered(use);
            completion(std::move(anchor));
        });
    use->callReturned();
}

Result<ItemsPage> ProviderClient::itemsOnPage(const TesselItemIdentifier& container, const TesselPage& page) {
    Awaited<Result<ItemsPage>> awaited;
    enumerateItems(container, page, awaited.completion());
    return awaited.wait();
}

Result<std::optional<TesselSyncAnchor>> ProviderClient::anchor(const TesselItemIdentifier& container) {
    Awaited<Result<std::optional<TesselSyncAnchor>>> awaited;
    currentSyncAnchor(container, awaited.completion());
    return awaited.wait();
}

Result<ChangesBatch> ProviderClient::changesSince(const TesselItemIdentifier& container,
                                                  const TesselSyncAnchor& anchor) {
    Awaited<Result<ChangesBatch>> awaited;
    enumerateChanges(container, anchor, awaited.completion());
    return awaited.wait();
}

}  // namespace cindral
