#pragma once

#include <map>
#include <vector>

#include "host/SearchQueries.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral::test {

/// Answers what the test says, and keeps what it was asked.
class FakeSearch final : public SearchQueries {
public:
    struct Asked {
        SearchQuery::Kind kind;
        std::string text;
        std::string page;
        std::size_t limit;
        friend bool operator==(const Asked&, const Asked&) = default;
    };
    std::vector<Asked> asked;
    std::vector<SortedQuery> askedSorted;
    std::vector<ItemsPage> pages;  ///< answered one after the other, the last of them from then on
    SortedPage sortedPage;
    std::vector<TagCount> tagCounts;
    std::optional<KsError> error;
    std::map<std::uint64_t, std::function<void()>> watches;
    std::vector<SearchQuery> watched;

    Result<ItemsPage> find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) override {
        asked.push_back({query.kind, query.text, page ? std::string(textOf(*page)) : "", limit});
        if (error) return *error;
        if (pages.empty()) return ItemsPage{};
        ItemsPage answer = pages.front();
        if (pages.size() > 1) pages.erase(pages.begin());
        return answer;
    }
    Result<SortedPage> sorted(const SortedQuery& query) override {
        askedSorted.push_back(query);
        if (error) return *error;
        return sortedPage;
    }
    Result<std::vector<TagCount>> tags() override {
        if (error) return *error;
        return tagCounts;
    }
    Result<std::uint64_t> watch(const SearchQuery& query, std::function<void()> changed) override {
        if (error) return *error;
        watched.push_back(query);
        watches.emplace(watched.size(), std::move(changed));
        return static_cast<std::uint64_t>(watched.size());
    }
    void unwatch(std::uint64_t watch) override { watches.erase(watch); }
};

}  // namespace cindral::test
