#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "host/ProviderAccess.h"
#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// What is looked for.
struct SearchQuery {
    /// Part of the pages that clients keep for a while: add numbers, never change one.
    enum class Kind : std::uint8_t {
        names = 0,      ///< `text` in the name: as its beginning, else that of a word, else anywhere
        recents = 1,    ///< documents
        tagged = 2,     ///< `text` is the tag
        favorites = 3,  ///< by rank
        trashed = 4,    ///< what was put into the trash, without what is in it
        children = 5,   ///< `text` is the container; for watches alone
        tags = 6,       ///< all tags; for watches alone
    };
    Kind kind = Kind::names;
    std::string text;
};

/// A view of one container in an order.
struct SortedQuery {
    enum class Order { name, date, size, kind };
    TesselItemIdentifier container;
    Order order = Order::name;
    bool isDescending = false;
    std::uint64_t offset = 0;
    std::size_t limit = 0;
};

struct SortedPage {
    TesselItems items;
    std::uint64_t total = 0;  ///< items of the container
};

struct TagCount {
    std::string tag;
    std::uint64_t count = 0;
};

/// What a client may ask across folders.
///
/// Every answer knows of everything that was complete before the question; where that takes a first look at all there
/// is, the answer waits for it. Items are what itemForIdentifier says of them.
///
/// Thread safety: all operations, from any thread; each may wait.
class SearchQueries {
public:
    static constexpr std::size_t kLimitUsual = 200;
    static constexpr std::size_t kLimitMax = 1'000;

    virtual ~SearchQueries() = default;

    /// At most `limit` items after the page. Within what matches equally well, the newest come first. Fewer than `limit`
    /// may come back before the end: what went meanwhile is left out.
    ///
    /// An expired page for bytes that are no page of this query. What changes its place while a client pages through
    /// may be seen twice, or not; a watch tells of it.
    virtual Result<ItemsPage> find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) = 0;
    virtual Result<SortedPage> sorted(const SortedQuery& query) = 0;
    /// In the order of names.
    virtual Result<std::vector<TagCount>> tags() = 0;

    /// From now until unwatch(), `changed` is called when what the query answers may be another: on any thread, by one
    /// at a time, with nothing held; it only passes on. Once for many changes at a time.
    virtual Result<std::uint64_t> watch(const SearchQuery& query, std::function<void()> changed) = 0;
    /// Returns when no call is under way any more. Not to be called by `changed`.
    virtual void unwatch(std::uint64_t watch) = 0;
};

}  // namespace cindral
