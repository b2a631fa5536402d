#include "host/ProviderClient.h"

#include <atomic>
#include <cerrno>

#include "platform/foundation/SerialQueue.h"

namespace cindral {
namespace {

bool isKept(const TesselItemIdentifier& container) {
    return container == kTesselRootContainerItemIdentifier || container == kTesselWorkingSetContainerItemIdentifier ||
           container == kTesselAllDirectoriesContainerItemIdentifier;
}

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

/// Waits for a completion's value.
template <typename Value>
class Awaited {
public:
    std::function<void(Value)> completion() {
        return [state = state_](Value value) {
            state->value = std::move(value);
            state->done.signal();
        };
    }
    Value wait() {
        state_->done.wait();
        return *std::move(state_->value);
    }

private:
    // Shared, because who waits may be gone before the signal's call has returned.
    struct State {
        DispatchSemaphore done{0};
        std::optional<Value> value;
    };
    std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace

/// An enumerator for the time of one request. One that is not kept is invalidated when the call has returned and the
/// request is answered, whichever comes later, and never from within a call of the enumerator's.
class ProviderClient::Use {
public:
    Use(std::shared_ptr<TesselEnumerator> enumerator, DispatchGroup* invalidations)
        : enumerator_(std::move(enumerator)), invalidations_(invalidations) {}

    TesselEnumerator& enumerator() { return *enumerator_; }

    void callReturned() {
        if (isLast() && invalidations_ != nullptr) enumerator_->invalidate();
    }
    /// Lets go of the use: once answered, the client and all it holds may be on their way out.
    static void answered(std::shared_ptr<Use>& use) {
        const std::shared_ptr<Use> last = std::move(use);
        if (!last->isLast() || last->invalidations_ == nullptr) return;
        last->invalidations_->enter();
        dispatchAsync([enumerator = last->enumerator_, group = last->invalidations_]() mutable {
            enumerator->invalidate();
            enumerator.reset();
            group->leave();
        });
    }

private:
    bool isLast() { return pending_.fetch_sub(1) == 1; }

    const std::shared_ptr<TesselEnumerator> enumerator_;
    DispatchGroup* const invalidations_;  // Null for one that is kept.
    std::atomic<int> pending_ = 2;
};

ProviderClient::~ProviderClient() {
    invalidations_.wait();
    const MutexLock lock(mutex_);
    for (const auto& [container, enumerator] : kept_) enumerator->invalidate();
}

Result<std::shared_ptr<ProviderClient::Use>> ProviderClient::use(const TesselItemIdentifier& container) {
    if (isKept(container)) return std::make_shared<Use>(TRY(keptEnumerator(container)), nullptr);
    return std::make_shared<Use>(TRY(provider_->enumeratorForContainerItemIdentifier(container)), &invalidations_);
}

Result<std::shared_ptr<TesselEnumerator>> ProviderClient::keptEnumerator(const TesselItemIdentifier& container) {
    const MutexLock lock(mutex_);
    const auto found = kept_.find(container);
    if (found != kept_.end()) return found->second;
    auto enumerator = TRY(provider_->enumeratorForContainerItemIdentifier(container));
    kept_.emplace(container, enumerator);
    return enumerator;
}

void ProviderClient::enumerateItems(const TesselItemIdentifier& container, const TesselPage& page,
                                    PageCompletion completion) {
    auto used = use(container);
    if (!used.ok()) {
        completion(std::move(used).error());
        return;
    }
    std::shared_ptr<Use> use = *std::move(used);
    use->enumerator().enumerateItemsForObserver(
        std::make_shared<PageCollector>([use, completion = std::move(completion)](Result<ItemsPage> result) mutable {
            Use::answered(use);
            completion(std::move(result));
        }),
        page);
    use->callReturned();
}

void ProviderClient::currentSyncAnchor(const TesselItemIdentifier& container, AnchorCompletion completion) {
    auto used = use(container);
    if (!used.ok()) {
        completion(std::move(used).error());
        return;
    }
    std::shared_ptr<Use> use = *std::move(used);
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

}  // namespace cindral
