#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "host/ContainerMonitor.h"
#include "host/ProviderClient.h"
#include "host/SearchQueries.h"
#include "host/SearchableItems.h"
#include "host/SignalDispatcher.h"
#include "host/search/NameCollation.h"
#include "host/search/SearchFollower.h"
#include "host/search/SearchStore.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// The search index: a client of the provider's working set that answers questions across folders.
///
/// It opens its file with the first question, or with follow(). Every question first has it follow the changes up to
/// now; questions that come together share that. Where nothing has been gathered yet, or the provider no longer knows
/// what has changed since, it gathers all there is, and who asks waits for the end of it.
///
/// A file that is found to be damaged is made anew, and the question is answered from what is gathered then.
///
/// Thread safety: all operations, from any thread.
class SearchIndex final : public SearchQueries, public SearchableItems {
public:
    /// Where the history of changes is: the number of its last event. Numbers of two histories can't be compared.
    struct Moment {
        std::string history;
        std::uint64_t event = 0;
    };
    using Clock = std::function<Moment()>;

    /// `file` is where it is kept. `signals` is borrowed for life. Without a clock nothing is behind.
    SearchIndex(std::shared_ptr<TesselExtension> provider, SignalDispatcher& signals, std::string file,
                std::string locale = NameCollation::localeOfProcess(), Clock clock = {});
    /// What waits is answered with ECANCELED.
    ~SearchIndex() override;
    SearchIndex(const SearchIndex&) = delete;
    SearchIndex& operator=(const SearchIndex&) = delete;

    /// From now on the index follows by itself, with every signal, so that a question finds little left to do.
    void follow();
    /// Nothing more is done: who waits, and who asks later, gets ECANCELED.
    void stop();
    /// Returns when the index knows everything that was complete before the call.
    Result<void> catchUp();

    Result<ItemsPage> find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) override;
    Result<SortedPage> sorted(const SortedQuery& query) override;
    Result<std::vector<TagCount>> tags() override;
    Result<std::uint64_t> watch(const SearchQuery& query, std::function<void()> changed) override;
    void unwatch(std::uint64_t watch) override;

    void deleteItems(const std::vector<std::string>& domains, TesselManager::Completion completion) override;

    struct Status {
        bool exists = false;  ///< false: nobody has asked for it yet
        bool isGathering = false;
        std::uint64_t items = 0;
        std::uint64_t bytes = 0;
        /// Events since it was at the present. Those that are none of its business count too until it has looked. None
        /// where all is to be gathered anew.
        std::optional<std::uint64_t> eventsBehind;
        std::optional<KsError> error;  ///< why it isn't at the present, where something went wrong
    };
    /// Opens a file that is there, and leaves it as it is.
    Status status();

    struct Audit {
        bool wasDamaged = false;        ///< and was made anew, now or since the last audit
        std::uint64_t missing = 0;      ///< items that were not in it
        std::uint64_t outdated = 0;     ///< items that were in it as they no longer are
        std::uint64_t superfluous = 0;  ///< items that were in it alone
    };
    /// Looks at the whole file, and gathers all there is once more, which puts right what is wrong. What comes, changes
    /// and goes meanwhile is counted too.
    Result<Audit> audit();

private:
    struct Watch {
        SearchQuery query;
        std::shared_ptr<const std::function<void()>> changed;
    };

    Result<std::shared_ptr<SearchStore>> store();
    Result<void> runOnce();
    Result<void> attempt();
    void schedule() REQUIRES(mutex_);
    void run();
    void witness(const IndexedItem& item);
    void noteAll();
    void tellWatches();
    bool hasFile() const;
    std::optional<std::uint64_t> eventsBehind(SearchStore& store, const std::optional<Moment>& reached);
    void noteMoment(const Moment& moment);
    void replaceDamaged(const std::shared_ptr<SearchStore>& damaged);
    template <typename Value>
    Result<Value> ask(const std::function<Result<Value>(SearchStore&)>& question);
    TesselItems lookUp(const std::vector<TesselItemIdentifier>& identifiers);

    // Constant after construction.
    const std::string file_;
    const std::string locale_;
    const Clock clock_;
    ProviderClient client_;
    SignalDispatcher& signals_;
    SearchFollower follower_{client_};

    Mutex storeMutex_;
    std::unique_ptr<NameCollation> collation_ GUARDED_BY(storeMutex_);  ///< null until there has been a store
    std::shared_ptr<SearchStore> store_ GUARDED_BY(storeMutex_);        ///< null until it is opened
    bool wasDamaged_ GUARDED_BY(storeMutex_) = false;                   ///< since the last audit

    Mutex mutex_;
    Condition reachedChanged_;
    std::uint64_t wanted_ GUARDED_BY(mutex_) = 0;   ///< number of the last request to catch up
    std::uint64_t reached_ GUARDED_BY(mutex_) = 0;  ///< of the last that is done
    Result<void> outcome_ GUARDED_BY(mutex_);       ///< of the run that did it
    bool isScheduled_ GUARDED_BY(mutex_) = false;
    bool isStopped_ GUARDED_BY(mutex_) = false;
    std::optional<Moment> reachedMoment_ GUARDED_BY(mutex_);

    Mutex watchesMutex_;
    std::map<std::uint64_t, Watch> watches_ GUARDED_BY(watchesMutex_);
    std::set<std::uint64_t> touched_ GUARDED_BY(watchesMutex_);  ///< watches whose answer may be another
    std::uint64_t lastWatch_ GUARDED_BY(watchesMutex_) = 0;

    SerialQueue queue_{"cindral.search-index"};
    SerialQueue watchQueue_{"cindral.search-watches"};

    Mutex monitorMutex_;
    std::unique_ptr<ContainerMonitor> monitor_ GUARDED_BY(monitorMutex_);  ///< null until follow()
};

}  // namespace cindral
