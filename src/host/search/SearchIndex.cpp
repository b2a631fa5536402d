#include "host/search/SearchIndex.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <limits>
#include <unordered_map>
#include <utility>

#include "platform/foundation/Log.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {

namespace {

KsDate dateOf(const TesselItem& item) {
    const auto used = item.lastUsedDate();
    return used ? *used : item.contentModificationDate().value_or(KsDate{std::numeric_limits<std::int64_t>::min()});
}

/// Items of nearly one date have places that are not in their order. Within a page, and what matches equally well, they
/// are put right.
void orderByDate(TesselItems& items, const std::vector<SearchStore::Hit>& hits) {
    std::unordered_map<std::string_view, std::uint8_t> stages;
    for (const auto& hit : hits) stages.emplace(hit.identifier, hit.place.stage);
    std::ranges::stable_sort(items, [&](const auto& a, const auto& b) {
        const auto stageOf = [&](const TesselItem& item) {
            const auto found = stages.find(item.itemIdentifier());
            return found != stages.end() ? found->second : 0;
        };
        return std::pair(stageOf(*a), dateOf(*b)) < std::pair(stageOf(*b), dateOf(*a));
    });
}

}  // namespace

SearchIndex::SearchIndex(std::shared_ptr<TesselExtension> provider, SignalDispatcher& signals, std::string file,
                         std::string locale, Clock clock)
    : file_(std::move(file)),
      locale_(std::move(locale)),
      clock_(std::move(clock)),
      client_(std::move(provider)),
      signals_(signals) {}

SearchIndex::~SearchIndex() {
    stop();
}

void SearchIndex::stop() {
    follower_.stop();
    std::unique_ptr<ContainerMonitor> monitor;
    {
        const MutexLock lock(monitorMutex_);
        monitor.swap(monitor_);
    }
    monitor.reset();
    {
        const MutexLock lock(mutex_);
        isStopped_ = true;
        reachedChanged_.notifyAll();
    }
    queue_.sync([] {});
    watchQueue_.sync([] {});
    std::optional<Moment> reached;
    {
        const MutexLock lock(mutex_);
        reached.swap(reachedMoment_);
    }
    if (reached) noteMoment(*reached);
}

/// For the status of the next process alone: where it can't be written, more seems to be left to do than there is.
void SearchIndex::noteMoment(const Moment& moment) {
    const MutexLock lock(storeMutex_);
    if (store_) (void)store_->setNote(fmt::format("{} {}", moment.history, moment.event));
}

// MARK: Following

Result<std::shared_ptr<SearchStore>> SearchIndex::store() {
    const MutexLock lock(storeMutex_);
    if (!store_) {
        if (!collation_) collation_ = std::make_unique<NameCollation>(locale_);
        store_ = TRY(SearchStore::open(file_, *collation_));
        wasDamaged_ = wasDamaged_ || store_->isReplacement();
        store_->setWitness([this](const IndexedItem& item) { witness(item); });
    }
    return store_;
}

void SearchIndex::follow() {
    {
        const MutexLock lock(monitorMutex_);
        if (monitor_) return;
        monitor_ = std::make_unique<ContainerMonitor>(client_, signals_, [this](const TesselItemIdentifier&) {
            const MutexLock inner(mutex_);
            ++wanted_;
            schedule();
        });
        const auto started = monitor_->start(kTesselWorkingSetContainerItemIdentifier);
        if (!started.ok()) logError("the search index has no signals; {}", started.error().description());
    }
    const MutexLock lock(mutex_);
    ++wanted_;
    schedule();
}

void SearchIndex::schedule() {
    if (isScheduled_ || isStopped_) return;
    isScheduled_ = true;
    queue_.async([this] { run(); });
}

void SearchIndex::run() {
    std::uint64_t target = 0;
    {
        const MutexLock lock(mutex_);
        target = wanted_;
    }
    Result<void> outcome = runOnce();
    if (!outcome.ok() && !outcome.error().isPosix(ECANCELED))
        logError("can't bring the search index to the present; {}", outcome.error().description());
    tellWatches();
    const MutexLock lock(mutex_);
    reached_ = target;
    outcome_ = std::move(outcome);
    isScheduled_ = false;
    if (wanted_ > target) schedule();
    reachedChanged_.notifyAll();
}

Result<void> SearchIndex::runOnce() {
    Result<void> done = attempt();
    if (!done.ok() && isDamagedDatabase(done.error())) done = attempt();
    return done;
}

Result<void> SearchIndex::attempt() {
    const auto current = TRY(store());
    bool gathered = false;
    const std::uint64_t changesBefore = current->changeCount();
    Result<void> done = follower_.catchUp(*current, gathered);
    if (gathered) noteAll();
    if (done.ok() && clock_) {
        // What was complete before is in the history by now. What came while it was followed counts as followed, for as
        // long as it takes its signal to come.
        Moment moment = clock_();
        // What has changed nothing costs no write.
        if (current->changeCount() != changesBefore) noteMoment(moment);
        const MutexLock lock(mutex_);
        reachedMoment_ = std::move(moment);
    }
    if (!done.ok() && isDamagedDatabase(done.error())) replaceDamaged(current);
    return done;
}

void SearchIndex::replaceDamaged(const std::shared_ptr<SearchStore>& damaged) {
    const MutexLock lock(storeMutex_);
    if (store_ != damaged) return;
    logError("making the search index anew; it is damaged");
    store_.reset();
    wasDamaged_ = true;
    if (const Result<void> removed = SearchStore::remove(file_); !removed.ok())
        logError("can't remove {}; {}", file_, removed.error().description());
}

Result<void> SearchIndex::catchUp() {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    const std::uint64_t mine = ++wanted_;
    schedule();
    while (reached_ < mine && !isStopped_) reachedChanged_.wait(mutex_);
    if (reached_ < mine) return KsError::posix(ECANCELED);
    return outcome_;
}

// MARK: Asking

template <typename Value>
Result<Value> SearchIndex::ask(const std::function<Result<Value>(SearchStore&)>& question) {
    for (int attempts = 0;; ++attempts) {
        TRY(catchUp());
        const auto current = TRY(store());
        Result<Value> answer = question(*current);
        if (answer.ok() || !isDamagedDatabase(answer.error()) || attempts > 0) return answer;
        replaceDamaged(current);
    }
}

TesselItems SearchIndex::lookUp(const std::vector<TesselItemIdentifier>& identifiers) {
    TesselItems items;
    items.reserve(identifiers.size());
    for (const auto& identifier : identifiers) {
        // What went since is left out.
        if (auto item = client_.provider().itemForIdentifier(identifier); item.ok()) items.push_back(*std::move(item));
    }
    return items;
}

Result<ItemsPage> SearchIndex::find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) {
    std::optional<QueryPage> after;
    if (page) {
        after = QueryPage::decode(*page);
        if (!after) return tesselErrorForExpiredPage();
    }
    const auto hits = TRY(ask<SearchStore::Hits>([&](SearchStore& store) { return store.find(query, after, limit); }));
    std::vector<TesselItemIdentifier> identifiers;
    for (const auto& hit : hits.hits) identifiers.push_back(hit.identifier);
    ItemsPage found;
    found.items = lookUp(identifiers);
    if (query.kind != SearchQuery::Kind::favorites) orderByDate(found.items, hits.hits);
    if (hits.hasMore) found.nextPage = hits.hits.back().place.encode();
    return found;
}

Result<SortedPage> SearchIndex::sorted(const SortedQuery& query) {
    const auto sorted = TRY(ask<SearchStore::Sorted>([&](SearchStore& store) { return store.sorted(query); }));
    // Nothing is in what does not exist, too.
    if (sorted.total == 0 && !client_.provider().itemForIdentifier(query.container).ok())
        return tesselErrorForNonExistentItemWithIdentifier(query.container);
    return SortedPage{lookUp(sorted.identifiers), sorted.total};
}

Result<std::vector<TagCount>> SearchIndex::tags() {
    return ask<std::vector<TagCount>>([](SearchStore& store) { return store.tags(); });
}

// MARK: Watches

Result<std::uint64_t> SearchIndex::watch(const SearchQuery& query, std::function<void()> changed) {
    // What is watched is what is there now.
    TRY(catchUp());
    std::uint64_t number = 0;
    {
        const MutexLock lock(watchesMutex_);
        number = ++lastWatch_;
        watches_.emplace(number, Watch{query, std::make_shared<const std::function<void()>>(std::move(changed))});
    }
    follow();
    return number;
}

void SearchIndex::unwatch(std::uint64_t watch) {
    {
        const MutexLock lock(watchesMutex_);
        watches_.erase(watch);
        touched_.erase(watch);
    }
    watchQueue_.sync([] {});
}

void SearchIndex::witness(const IndexedItem& item) {
    const MutexLock lock(watchesMutex_);
    for (const auto& [number, watch] : watches_) {
        if (!touched_.contains(number) && item.isIn(watch.query)) touched_.insert(number);
    }
}

void SearchIndex::noteAll() {
    const MutexLock lock(watchesMutex_);
    for (const auto& [number, watch] : watches_) touched_.insert(number);
}

void SearchIndex::tellWatches() {
    {
        const MutexLock lock(watchesMutex_);
        if (touched_.empty()) return;
    }
    watchQueue_.async([this] {
        std::vector<std::shared_ptr<const std::function<void()>>> told;
        {
            const MutexLock lock(watchesMutex_);
            for (const std::uint64_t number : std::exchange(touched_, {})) {
                if (const auto found = watches_.find(number); found != watches_.end())
                    told.push_back(found->second.changed);
            }
        }
        for (const auto& changed : told) (*changed)();
    });
}

// MARK: What the provider and the person want of it

void SearchIndex::deleteItems(const std::vector<std::string>& domains, TesselManager::Completion completion) {
    const auto forget = [&]() -> Result<void> {
        {
            // Where there is no index yet, there is nothing to forget.
            const MutexLock lock(storeMutex_);
            if (!store_ && !hasFile()) return {};
        }
        TRY(TRY(store())->forgetDomains(domains));
        tellWatches();
        return {};
    }();
    if (!forget.ok()) logError("can't take what is gone out of the search index; {}", forget.error().description());
    if (completion) completion(forget.ok() ? std::nullopt : std::optional(forget.error()));
}

bool SearchIndex::hasFile() const {
    struct stat there {};
    return ::lstat(file_.c_str(), &there) == 0;
}

std::optional<std::uint64_t> SearchIndex::eventsBehind(SearchStore& store, const std::optional<Moment>& reached) {
    if (!clock_) return 0;
    const Moment now = clock_();
    const auto since = [&](const Moment& then) {
        return then.history == now.history && then.event <= now.event ? std::optional(now.event - then.event)
                                                                      : std::nullopt;
    };
    if (reached) return since(*reached);
    // As the last process left it.
    const Result<std::string> note = store.note();
    if (!note.ok()) return std::nullopt;
    const std::size_t space = note->find(' ');
    Moment then{note->substr(0, space), 0};
    const char* const end = note->data() + note->size();
    if (space == std::string::npos || std::from_chars(note->data() + space + 1, end, then.event).ptr != end)
        return std::nullopt;
    return since(then);
}

SearchIndex::Status SearchIndex::status() {
    Status status;
    std::optional<Moment> reached;
    {
        const MutexLock lock(mutex_);
        reached = reachedMoment_;
        if (!outcome_.ok() && !outcome_.error().isPosix(ECANCELED)) status.error = outcome_.error();
    }
    {
        const MutexLock lock(storeMutex_);
        status.exists = store_ || hasFile();
    }
    if (!status.exists) return status;
    const auto current = store();
    if (!current.ok()) {
        status.error = current.error();
        return status;
    }
    if (const auto counts = (*current)->counts(); counts.ok()) {
        status.items = counts->items;
        status.bytes = counts->bytes;
    }
    status.isGathering = (*current)->isGathering();
    if (!status.isGathering) status.eventsBehind = eventsBehind(**current, reached);
    return status;
}

Result<SearchIndex::Audit> SearchIndex::audit() {
    Audit audit;
    const auto gathersOf = [](SearchStore& store) { return store.gatherCounts().gather; };
    const std::uint64_t before = hasFile() ? gathersOf(*TRY(store())) : 0;
    TRY(catchUp());
    auto current = TRY(store());
    const Result<void> checked = current->check();
    if (!checked.ok() && !isDamagedDatabase(checked.error())) return checked.error();
    if (!checked.ok()) {
        replaceDamaged(current);
        TRY(catchUp());
    } else if (gathersOf(*current) == before) {
        Result<void> begun;
        queue_.sync([&] { begun = follower_.beginGather(*current); });
        TRY(std::move(begun));
        TRY(catchUp());
        const SearchStore::GatherCounts found = current->gatherCounts();
        audit.missing = found.put;
        audit.outdated = found.changed;
        audit.superfluous = found.removed;
    }
    const MutexLock lock(storeMutex_);
    audit.wasDamaged = std::exchange(wasDamaged_, false);
    return audit;
}

}  // namespace cindral
