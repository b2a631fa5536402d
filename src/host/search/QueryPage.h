#pragma once

#include <cstdint>
#include <optional>

#include "host/SearchQueries.h"

namespace cindral {

/// Where a page of a query ended: docs/search-index.md has the bytes.
///
/// Thread safety: a value.
struct QueryPage {
    std::uint64_t index = 0;  ///< which index the place is one of
    std::uint64_t query = 0;  ///< queryHash()
    std::uint8_t stage = 0;   ///< of a query that gathers its answer in several
    std::int64_t rank = 0;    ///< of the last item, where the order is by rank
    std::int64_t place = 0;   ///< of the last item in the index

    Bytes encode() const;
    /// None for anything that encode() didn't write.
    static std::optional<QueryPage> decode(ByteView bytes);
    static std::uint64_t queryHash(const SearchQuery& query);

    friend bool operator==(const QueryPage&, const QueryPage&) = default;
};

}  // namespace cindral
