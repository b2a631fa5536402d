#include "host/RemoteSearch.h"

#include <fmt/format.h>

#include <cerrno>
#include <utility>

#include "host/RemoteError.h"
#include "host/RemoteItem.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

using Params = DaemonConnection::Params;

/// The method that answers the query; null where none does.
const char* methodOf(SearchQuery::Kind kind) {
    switch (kind) {
        case SearchQuery::Kind::names: return "search";
        case SearchQuery::Kind::recents: return "recents";
        case SearchQuery::Kind::tagged: return "taggedItems";
        case SearchQuery::Kind::favorites: return "favorites";
        case SearchQuery::Kind::trashed: return "trashedItems";
        case SearchQuery::Kind::children:
        case SearchQuery::Kind::tags: return nullptr;
    }
    return nullptr;
}

const char* nameOf(SortedQuery::Order order) {
    switch (order) {
        case SortedQuery::Order::name: return "name";
        case SortedQuery::Order::date: return "date";
        case SortedQuery::Order::size: return "size";
        case SortedQuery::Order::kind: return "kind";
    }
    return "name";
}

}  // namespace

Result<ItemsPage> RemoteSearch::find(const SearchQuery& query, const std::optional<Bytes>& page, std::size_t limit) {
    const char* method = methodOf(query.kind);
    if (method == nullptr) return KsError::posix(ENOTSUP);
    Params params;
    params.addJson("limit", fmt::to_string(limit));
    if (query.kind == SearchQuery::Kind::names) params.add("text", query.text);
    if (query.kind == SearchQuery::Kind::tagged) params.add("tag", query.text);
    if (page) params.add("page", base64Encode(*page));
    return itemsPageFromJson(TRY(connection_.call(method, params)));
}

Result<SortedPage> RemoteSearch::sorted(const SortedQuery& query) {
    Params params;
    params.add("container", query.container).add("sort", nameOf(query.order));
    params.addJson("descending", query.isDescending ? "true" : "false");
    params.addJson("offset", fmt::to_string(query.offset)).addJson("limit", fmt::to_string(query.limit));
    const Json answer = TRY(connection_.call("sortedItems", params));
    const auto total = answer.find("total");
    if (total == answer.end() || !total->is_number_unsigned()) return unreadableAnswer();
    return SortedPage{.items = TRY(itemsFromJson(answer)), .total = total->get<std::uint64_t>()};
}

Result<std::vector<TagCount>> RemoteSearch::tags() {
    const Json answer = TRY(connection_.call("tags", Params()));
    const auto tags = answer.find("tags");
    if (tags == answer.end() || !tags->is_array()) return unreadableAnswer();
    std::vector<TagCount> result;
    for (const Json& each : *tags) {
        const auto tag = each.find("tag");
        const auto count = each.find("count");
        if (tag == each.end() || !tag->is_string() || count == each.end() || !count->is_number_unsigned())
            return unreadableAnswer();
        result.push_back({tag->get<std::string>(), count->get<std::uint64_t>()});
    }
    return result;
}

Result<std::uint64_t> RemoteSearch::watch(const SearchQuery& /*query*/, std::function<void()> /*changed*/) {
    return KsError::posix(ENOTSUP);
}

}  // namespace cindral
