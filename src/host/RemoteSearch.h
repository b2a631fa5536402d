#pragma once

#include "host/DaemonConnection.h"
#include "host/SearchQueries.h"

namespace cindral {

/// What can be asked across folders, asked of the daemon.
///
/// Commands watch nothing: that is answered with ENOTSUP.
///
/// Thread safety: all operations, from any thread.
class RemoteSearch final : public SearchQueries {
public:
    /// Borrowed for life.
    explicit RemoteSearch(DaemonConnection& connection) : connection_(connection) {}

    Result<ItemsPage> find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) override;
    Result<SortedPage> sorted(const SortedQuery& query) override;
    Result<std::vector<TagCount>> tags() override;

    Result<std::uint64_t> watch(const SearchQuery& query, std::function<void()> changed) override;
    void unwatch(std::uint64_t /*watch*/) override {}

private:
    DaemonConnection& connection_;
};

}  // namespace cindral
