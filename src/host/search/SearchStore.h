#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "host/search/IndexedItem.h"
#include "host/search/NameCollation.h"
#include "host/search/NameSample.h"
#include "host/search/QueryPage.h"
#include "host/search/Sqlite.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// The search index's file: what is kept of each item, and how far the changes have been followed.
///
/// Every change goes in together with the anchor that follows it, so that after a crash the two belong together. A file
/// that is damaged, of another version, of another order of names, or none of ours at all is made anew, with one line.
///
/// Format: docs/search-index.md.
///
/// Errors are those of SqliteDatabase; a damaged database (isDamagedDatabase) is to be made anew with remake().
///
/// Thread safety: all operations, from any thread. Who reads and who writes don't wait for each other.
class SearchStore {
public:
    /// Sees each item that is changed, as it was and as it becomes, within the transaction.
    using Witness = std::function<void(const IndexedItem&)>;

    /// `collation` is borrowed for life.
    static Result<std::unique_ptr<SearchStore>> open(std::string path, const NameCollation& collation);
    /// Removes the file, and what is beside it.
    static Result<void> remove(const std::string& path);

    ~SearchStore();
    SearchStore(const SearchStore&) = delete;
    SearchStore& operator=(const SearchStore&) = delete;

    void setWitness(Witness witness);

    // Following

    struct Position {
        std::optional<TesselSyncAnchor> anchor;  ///< none: nothing has been gathered yet
        bool isGathering = false;                ///< what is there is not all
    };
    Result<Position> position();
    /// The same, without waiting for who writes.
    bool isGathering() const { return isGathering_; }
    /// From now on what is put in counts as found, and what was not found by endGather() goes. Containers that are come
    /// upon are to be listed, the first among them.
    Result<void> beginGather(const TesselSyncAnchor& anchor, std::span<const TesselItemIdentifier> firstContainers);
    /// Some of those that are to be listed.
    Result<std::vector<TesselItemIdentifier>> unlisted(std::size_t max);
    Result<void> putListed(std::span<const IndexedItem> items, std::span<const TesselItemIdentifier> listed,
                           std::span<const TesselItemIdentifier> more);
    /// How many items are best put in together: places lie all over the table, so that each time nearly every page of it
    /// is written.
    std::size_t itemsAtOnce();
    Result<void> apply(const ChangesBatch& batch);
    Result<void> endGather();
    struct GatherCounts {
        std::uint64_t gather = 0;   ///< its number
        std::uint64_t put = 0;      ///< that were not there
        std::uint64_t changed = 0;  ///< that were there otherwise
        std::uint64_t removed = 0;  ///< that were not found
    };
    /// Of the gather that is under way, or was the last; 0 for what was done before the store was opened.
    GatherCounts gatherCounts();
    /// A note of its owner's, kept with the rest; empty for none.
    Result<void> setNote(const std::string& note);
    Result<std::string> note();
    /// Grows with each transaction that puts in or takes out.
    std::uint64_t changeCount() const { return changes_; }
    /// Whether it took the place of another file, which was damaged or of another form, when it was opened.
    bool isReplacement() const { return isReplacement_; }
    /// Takes out what belongs to the domains. Remembers them until the next confirmDomains().
    Result<void> forgetDomains(const std::vector<std::string>& domains);
    Result<std::vector<std::string>> forgottenDomains();
    Result<void> confirmDomains();

    // Asking

    struct Hit {
        TesselItemIdentifier identifier;
        QueryPage place;
    };
    struct Hits {
        std::vector<Hit> hits;
        bool hasMore = false;
    };
    /// An expired page for a place in another index or of another query.
    Result<Hits> find(const SearchQuery& query, const std::optional<QueryPage>& after, std::size_t limit);
    struct Sorted {
        std::vector<TesselItemIdentifier> identifiers;
        std::uint64_t total = 0;
    };
    Result<Sorted> sorted(const SortedQuery& query);
    Result<std::vector<TagCount>> tags();

    struct Counts {
        std::uint64_t items = 0;
        std::uint64_t bytes = 0;  ///< of the file
    };
    Result<Counts> counts();
    /// Every item's identifier, for who compares.
    Result<std::vector<TesselItemIdentifier>> identifiers();
    /// Looks at every page of the file. An error of a damaged database where one is not what it should be.
    Result<void> check();

private:
    struct Writer;
    struct Reader;
    struct View {
        TesselItemIdentifier container;
        SortedQuery::Order order{};
        std::uint64_t change = 0;
        std::vector<std::int64_t> places;
    };
    SearchStore(std::string path, const NameCollation& collation);
    Result<void> openBoth();

    template <typename Work>
    Result<void> write(const Work& work) REQUIRES(writerMutex_);
    Result<const View*> view(const SortedQuery& query) REQUIRES(readerMutex_);
    Result<void> findNames(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits)
        REQUIRES(readerMutex_);
    Result<void> findOneByOne(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits)
        REQUIRES(readerMutex_);
    Result<bool> findAtOnce(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits)
        REQUIRES(readerMutex_);
    Result<void> refreshSample() REQUIRES(readerMutex_);
    Result<void> appendByValue(const SortedQuery& query, std::vector<std::int64_t>& places) REQUIRES(readerMutex_);

    // Constant after construction.
    const std::string path_;
    const NameCollation& collation_;
    std::uint64_t index_ = 0;

    std::atomic<std::uint64_t> changes_ = 0;
    std::atomic<bool> isGathering_ = false;
    bool isReplacement_ = false;  ///< constant once it is open

    /// Held over transactions, and so over the disk.
    Mutex writerMutex_;
    std::unique_ptr<Writer> writer_ GUARDED_BY(writerMutex_);
    /// The same for reading.
    Mutex readerMutex_;
    std::unique_ptr<Reader> reader_ GUARDED_BY(readerMutex_);
    std::list<View> views_ GUARDED_BY(readerMutex_);  ///< newest first
    NameSample sample_ GUARDED_BY(readerMutex_);
    std::uint64_t sampledAt_ GUARDED_BY(readerMutex_) = 0;  ///< change after which the sample was taken
};

}  // namespace cindral
