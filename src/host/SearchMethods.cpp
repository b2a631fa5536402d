#include "host/SearchMethods.h"

#include <algorithm>
#include <memory>
#include <optional>
#include <utility>

#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/RequestParams.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

using Reply = std::shared_ptr<JsonRpcReply>;

void appendItems(std::string& out, const TesselItems& items, const PresentedPaths& paths) {
    ItemWriter writer(paths);
    ItemWriter::reserve(out, items.size());
    out += R"({"items":[)";
    bool isFirst = true;
    for (const auto& item : items) {
        if (!isFirst) out += ',';
        isFirst = false;
        writer.append(out, *item);
    }
    out += ']';
}

/// How many items are asked for. None once the request is answered.
std::optional<std::size_t> limitOf(const RequestParams& given, JsonRpcReply& reply) {
    if (!given.has("limit")) return SearchQueries::kLimitUsual;
    const auto limit = given.integer("limit");
    if (!limit) return std::nullopt;
    if (*limit > 0) return static_cast<std::size_t>(std::min<std::int64_t>(*limit, SearchQueries::kLimitMax));
    reply.error(JsonRpcCode::invalidParams, "\"limit\" is not a number of items");
    return std::nullopt;
}

void find(const HostMethodsContext& context, const SearchQuery& query, const RequestParams& given, const Reply& reply) {
    const auto limit = limitOf(given, *reply);
    if (!limit) return;
    std::optional<Bytes> page;
    if (given.has("page") && !given.isNull("page")) {
        page = given.base64("page");
        if (!page) return;
    }
    const Result<ItemsPage> found = context.search.find(query, page, *limit);
    if (!found.ok()) return answerWithError(*reply, found.error(), context.paths);
    reply->result([&](std::string& out) {
        appendItems(out, found->items, context.paths);
        out += R"(,"nextPage":)";
        if (found->nextPage) {
            out += '"';
            appendBase64(out, *found->nextPage);
            out += "\"}";
        } else {
            out += "null}";
        }
    });
}

/// What a method's name and parameters ask for. None once the request is answered.
std::optional<SearchQuery> queryNamed(std::string_view name, const RequestParams& given, JsonRpcReply& reply) {
    struct Named {
        std::string_view name;
        SearchQuery::Kind kind;
        const char* text;  ///< the parameter; null for none
    };
    constexpr Named kQueries[] = {
        {"search", SearchQuery::Kind::names, "text"},
        {"recents", SearchQuery::Kind::recents, nullptr},
        {"taggedItems", SearchQuery::Kind::tagged, "tag"},
        {"favorites", SearchQuery::Kind::favorites, nullptr},
        {"trashedItems", SearchQuery::Kind::trashed, nullptr},
        {"tags", SearchQuery::Kind::tags, nullptr},
        {"sortedItems", SearchQuery::Kind::children, "container"},
    };
    const auto* named = std::ranges::find(kQueries, name, &Named::name);
    if (named == std::end(kQueries)) {
        reply.error(JsonRpcCode::invalidParams, "\"query\" is not the name of a query");
        return std::nullopt;
    }
    if (named->text == nullptr) return SearchQuery{named->kind, ""};
    auto text = given.string(named->text);
    if (!text) return std::nullopt;
    return SearchQuery{named->kind, *std::move(text)};
}

template <SearchQuery::Kind kKind>
void findOf(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    SearchQuery query{kKind, ""};
    if constexpr (kKind == SearchQuery::Kind::names || kKind == SearchQuery::Kind::tagged) {
        auto text = given.string(kKind == SearchQuery::Kind::names ? "text" : "tag");
        if (!text) return;
        query.text = *std::move(text);
    }
    find(context, query, given, reply);
}

void sortedItems(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    SortedQuery query;
    auto container = given.string("container");
    const auto limit = container ? limitOf(given, *reply) : std::nullopt;
    if (!limit) return;
    query.container = *std::move(container);
    query.limit = *limit;
    if (given.has("sort")) {
        const auto sort = given.string("sort");
        if (!sort) return;
        constexpr std::pair<std::string_view, SortedQuery::Order> kOrders[] = {
            {"name", SortedQuery::Order::name},
            {"date", SortedQuery::Order::date},
            {"size", SortedQuery::Order::size},
            {"kind", SortedQuery::Order::kind},
        };
        const auto* order = std::ranges::find(kOrders, std::string_view(*sort),
                                              &std::pair<std::string_view, SortedQuery::Order>::first);
        if (order == std::end(kOrders))
            return reply->error(JsonRpcCode::invalidParams, "\"sort\" is none of name, date, size, kind");
        query.order = order->second;
    }
    if (!given.optionalBoolean("descending", query.isDescending)) return;
    if (given.has("offset")) {
        const auto offset = given.integer("offset");
        if (!offset) return;
        if (*offset < 0) return reply->error(JsonRpcCode::invalidParams, "\"offset\" is not a number of items");
        query.offset = static_cast<std::uint64_t>(*offset);
    }
    const Result<SortedPage> sorted = context.search.sorted(query);
    if (!sorted.ok()) return answerWithError(*reply, sorted.error(), context.paths);
    reply->result([&](std::string& out) {
        appendItems(out, sorted->items, context.paths);
        out += R"(,"total":)";
        appendJsonNumber(out, sorted->total);
        out += '}';
    });
}

void tags(const HostMethodsContext& context, const Json& /*params*/, const Reply& reply) {
    const auto tags = context.search.tags();
    if (!tags.ok()) return answerWithError(*reply, tags.error(), context.paths);
    reply->result([&](std::string& out) {
        out += R"({"tags":[)";
        bool isFirst = true;
        for (const TagCount& each : *tags) {
            out += isFirst ? R"({"tag":)" : R"(,{"tag":)";
            isFirst = false;
            appendJsonString(out, each.tag);
            out += R"(,"count":)";
            appendJsonNumber(out, each.count);
            out += '}';
        }
        out += "]}";
    });
}

void watchQuery(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto name = given.string("query");
    const auto query = name ? queryNamed(*name, given, *reply) : std::nullopt;
    if (!query) return;
    const auto watch = context.watches.watch(*query);
    if (!watch.ok()) return answerWithError(*reply, watch.error(), context.paths);
    reply->result([&](std::string& out) {
        out += R"({"watch":)";
        appendJsonNumber(out, *watch);
        out += '}';
    });
}

void unwatchQuery(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto watch = RequestParams(params, *reply).integer("watch");
    if (!watch) return;
    if (*watch <= 0 || !context.watches.unwatch(static_cast<std::uint64_t>(*watch)))
        return reply->error(JsonRpcCode::invalidParams, "\"watch\" is not the number of a watch");
    reply->result([](std::string& out) { out += "{}"; });
}

}  // namespace

JsonRpcServer::Methods makeSearchMethods(const HostMethodsContext& context) {
    constexpr HostMethod kMethods[] = {
        {"search", findOf<SearchQuery::Kind::names>},
        {"recents", findOf<SearchQuery::Kind::recents>},
        {"taggedItems", findOf<SearchQuery::Kind::tagged>},
        {"favorites", findOf<SearchQuery::Kind::favorites>},
        {"trashedItems", findOf<SearchQuery::Kind::trashed>},
        {"sortedItems", sortedItems},
        {"tags", tags},
        {"watchQuery", watchQuery},
        {"unwatchQuery", unwatchQuery},
    };
    return bindHostMethods(context, kMethods);
}

}  // namespace cindral
