#include "host/HostMethods.h"

#include <fmt/format.h>

#include <cerrno>
#include <optional>

#include "host/EditMethods.h"
#include "host/HostError.h"
#include "host/ItemWriter.h"
#include "host/JsonText.h"
#include "host/RequestParams.h"
#include "host/SearchMethods.h"
#include "platform/foundation/Base64.h"
#include "platform/foundation/Utf8.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

/// Beyond this a size is as good as any: the provider takes it for a wish.
constexpr std::int64_t kThumbnailPixelsMax = 65'536;

using Reply = std::shared_ptr<JsonRpcReply>;

/// A value that may be none, as the one member of an object.
template <typename Append>
void answerOptional(JsonRpcReply& reply, std::string_view key, bool hasValue, Append append) {
    reply.result([&](std::string& out) {
        out += "{\"";
        out += key;
        out += "\":";
        if (hasValue) {
            append(out);
        } else {
            out += "null";
        }
        out += '}';
    });
}

void answerBase64(JsonRpcReply& reply, std::string_view key, const std::optional<Bytes>& bytes) {
    answerOptional(reply, key, bytes.has_value(), [&](std::string& out) {
        out += '"';
        appendBase64(out, *bytes);
        out += '"';
    });
}

void answerPage(JsonRpcReply& reply, const Result<ItemsPage>& page, const PresentedPaths& paths) {
    if (!page.ok()) return answerWithError(reply, page.error(), paths);
    reply.result([&](std::string& out) {
        ItemWriter writer(paths);
        ItemWriter::reserve(out, page->items.size());
        out += R"({"items":[)";
        bool isFirst = true;
        for (const auto& item : page->items) {
            if (!isFirst) out += ',';
            isFirst = false;
            writer.append(out, *item);
        }
        out += R"(],"nextPage":)";
        if (page->nextPage) {
            out += '"';
            appendBase64(out, *page->nextPage);
            out += "\"}";
        } else {
            out += "null}";
        }
    });
}

void itemForIdentifier(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto identifier = RequestParams(params, *reply).string("identifier");
    if (identifier) answerItem(*reply, context.client.provider().itemForIdentifier(*identifier), context.paths);
}

void urlForItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto identifier = RequestParams(params, *reply).string("identifier");
    if (!identifier) return;
    const auto url = context.client.provider().URLForItemWithPersistentIdentifier(*identifier);
    answerOptional(*reply, "url", url.has_value(),
                   [&](std::string& out) { appendJsonString(out, context.paths.realURL(*url)); });
}

void identifierForItemAtURL(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto url = RequestParams(params, *reply).urlOrPath();
    if (!url) return;
    const auto identifier =
        context.client.provider().persistentIdentifierForItemAtURL(context.paths.presentedURL(*url));
    answerOptional(*reply, "identifier", identifier.has_value(),
                   [&](std::string& out) { appendJsonString(out, *identifier); });
}

void enumerateItems(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto container = given.string("container");
    if (!container) return;
    const auto page = given.page();
    if (!page) return;
    context.client.enumerateItems(*container, *page, [reply, &paths = context.paths](const Result<ItemsPage>& result) {
        answerPage(*reply, result, paths);
    });
}

void currentSyncAnchor(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto container = RequestParams(params, *reply).string("container");
    if (!container) return;
    context.client.currentSyncAnchor(*container,
                                     [reply, &paths = context.paths](Result<std::optional<TesselSyncAnchor>> anchor) {
                                         if (!anchor.ok()) return answerWithError(*reply, anchor.error(), paths);
                                         answerBase64(*reply, "anchor", *anchor);
                                     });
}

void answerChanges(JsonRpcReply& reply, const Result<ChangesBatch>& changes, const PresentedPaths& paths) {
    if (!changes.ok()) return answerWithError(reply, changes.error(), paths);
    reply.result([&](std::string& out) {
        ItemWriter writer(paths);
        ItemWriter::reserve(out, changes->log.size());
        // Each list with its own view of the log.
        const auto appendList = [&](std::string_view key, const auto& append) {
            out += key;
            out += '[';
            const std::size_t begin = out.size();
            for (const auto& entry : changes->log) append(entry, out.size() == begin ? "" : ",");
            out += ']';
        };
        appendList(R"({"updated":)", [&](const ChangesBatch::Entry& entry, std::string_view comma) {
            if (!entry.item) return;
            out += comma;
            writer.append(out, *entry.item);
        });
        appendList(R"(,"deleted":)", [&](const ChangesBatch::Entry& entry, std::string_view comma) {
            if (entry.item) return;
            out += comma;
            appendJsonString(out, entry.identifier);
        });
        out += R"(,"anchor":")";
        appendBase64(out, changes->anchor);
        out += changes->moreComing ? R"(","moreComing":true)" : R"(","moreComing":false)";
        appendList(R"(,"log":)", [&](const ChangesBatch::Entry& entry, std::string_view comma) {
            out += comma;
            out += entry.item ? R"(["u",)" : R"(["d",)";
            appendJsonString(out, entry.identifier);
            out += ']';
        });
        out += '}';
    });
}

void enumerateChanges(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto container = given.string("container");
    if (!container) return;
    const auto anchor = given.base64("anchor");
    if (!anchor) return;
    context.client.enumerateChanges(*container, *anchor,
                                    [reply, &paths = context.paths](const Result<ChangesBatch>& changes) {
                                        answerChanges(*reply, changes, paths);
                                    });
}

void startMonitoring(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto container = RequestParams(params, *reply).string("container");
    if (!container) return;
    const auto started = context.monitor.start(*container);
    if (!started.ok()) return answerWithError(*reply, started.error(), context.paths);
    reply->result([](std::string& out) { out += "{}"; });
}

void stopMonitoring(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto container = RequestParams(params, *reply).string("container");
    if (!container) return;
    context.monitor.stop(*container);
    reply->result([](std::string& out) { out += "{}"; });
}

void defaultContainer(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto bundleIdentifier = RequestParams(params, *reply).string("bundleIdentifier");
    if (!bundleIdentifier) return;
    context.client.provider().defaultApplicationContainerForBundleIdentifier(
        *bundleIdentifier, [reply, &paths = context.paths](const Result<std::shared_ptr<const TesselItem>>& item) {
            answerItem(*reply, item, paths);
        });
}

void fetchThumbnails(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifiers = given.strings("identifiers");
    if (!identifiers) return;
    const auto size = given.integer("size");
    if (!size) return;
    if (*size <= 0) return reply->error(JsonRpcCode::invalidParams, "\"size\" is not a number of pixels");
    // Each is answered in order, on this thread, before the completion.
    auto out = std::make_shared<std::string>(R"({"thumbnails":[)");
    context.client.provider().fetchThumbnailsForItemIdentifiers(
        *identifiers, static_cast<unsigned>(std::min(*size, kThumbnailPixelsMax)),
        [out](const TesselItemIdentifier& identifier, const std::optional<Bytes>& png) {
            if (out->back() != '[') *out += ',';
            *out += R"({"identifier":)";
            appendJsonString(*out, identifier);
            *out += R"(,"png":)";
            if (png) {
                *out += '"';
                appendBase64(*out, *png);
                *out += "\"}";
            } else {
                *out += "null}";
            }
        },
        [out, reply](const std::optional<KsError>&) {
            reply->result([&](std::string& text) { text += *out + "]}"; });
        });
}

void status(const HostMethodsContext& context, const Json& /*params*/, const Reply& reply) {
    reply->result([&](std::string& out) { out += context.statusText(); });
}

void doctor(const HostMethodsContext& context, const Json& /*params*/, const Reply& reply) {
    const Result<std::string> done = context.doctorText();
    if (!done.ok()) return answerWithError(*reply, done.error(), context.paths);
    reply->result([&](std::string& out) { out += *done; });
}

void hello(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto endsSoon = params.find("endsSoon");
    const bool says = endsSoon != params.end() && endsSoon->is_boolean() && endsSoon->get<bool>();
    reply->result([&](std::string& out) { out += context.hello(says); });
}

void makeLink(const HostMethodsContext& context, const Json& /*params*/, const Reply& reply) {
    if (!context.makeLink) return answerWithError(*reply, KsError::posix(ENOTSUP), context.paths);
    const auto link = context.makeLink();
    if (!link.ok()) return answerWithError(*reply, link.error(), context.paths);
    answerOptional(*reply, "url", true, [&](std::string& out) { appendJsonString(out, *link); });
}

}  // namespace

void answerWithError(JsonRpcReply& reply, const KsError& error, const PresentedPaths& paths) {
    std::string data = R"({"domain":)";
    appendJsonString(data, error.domain());
    data += R"(,"code":)";
    appendJsonNumber(data, error.code());
    for (const auto& [key, value] : error.userInfo()) {
        if (key == "message" || key == "domain" || key == "code" || key == "collidingURL") continue;
        data += ',';
        appendJsonString(data, key);
        data += ':';
        const std::string shown = key == "path" ? paths.realPath(value) : value;
        appendJsonString(data, shown);
        if (key != "path" || isUtf8(shown)) continue;
        data += R"(,"pathURL":"file://)";
        appendPercentEncoded(data, shown);
        data += '"';
    }
    if (const auto item = collidingItem(error)) {
        data += R"(,"item":)";
        ItemWriter(paths).append(data, *item);
    }
    data += '}';
    reply.error(JsonRpcCode::operationFailed, messageOf(error), data);
}

void answerItem(JsonRpcReply& reply, const Result<std::shared_ptr<const TesselItem>>& item,
                const PresentedPaths& paths) {
    if (!item.ok()) return answerWithError(reply, item.error(), paths);
    reply.result([&](std::string& out) { ItemWriter(paths).append(out, **item); });
}

JsonRpcServer::Methods bindHostMethods(const HostMethodsContext& context, std::span<const HostMethod> handlers) {
    JsonRpcServer::Methods methods;
    for (const auto& [name, handler] : handlers) {
        methods.emplace(name, [context, handler = handler](const Json& params, const Reply& reply) {
            handler(context, params, reply);
        });
    }
    return methods;
}

JsonRpcServer::Methods makeHostMethods(const HostMethodsContext& context) {
    constexpr HostMethod kMethods[] = {
        {"itemForIdentifier", itemForIdentifier},
        {"URLForItem", urlForItem},
        {"identifierForItemAtURL", identifierForItemAtURL},
        {"enumerateItems", enumerateItems},
        {"currentSyncAnchor", currentSyncAnchor},
        {"enumerateChanges", enumerateChanges},
        {"startMonitoring", startMonitoring},
        {"stopMonitoring", stopMonitoring},
        {"defaultContainer", defaultContainer},
        {"fetchThumbnails", fetchThumbnails},
        {"status", status},
        {"hello", hello},
        {"doctor", doctor},
        {"makeLink", makeLink},
    };
    JsonRpcServer::Methods methods = makeEditMethods(context);
    methods.merge(makeSearchMethods(context));
    methods.merge(bindHostMethods(context, kMethods));
    return methods;
}

}  // namespace cindral
