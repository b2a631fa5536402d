#include "host/EditMethods.h"

#include <cerrno>
#include <functional>
#include <memory>
#include <optional>
#include <type_traits>
#include <utility>
#include <vector>

#include "host/ImportStaging.h"
#include "host/ProgressNotifier.h"
#include "host/RequestParams.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselTags.h"

namespace cindral {
namespace {

using Reply = std::shared_ptr<JsonRpcReply>;
using ItemResult = Result<std::shared_ptr<const TesselItem>>;

TesselExtension::ItemCompletion itemCompletion(const HostMethodsContext& context, const Reply& reply) {
    return [reply, &paths = context.paths](const Result<std::shared_ptr<const TesselItem>>& item) {
        answerItem(*reply, item, paths);
    };
}

TesselExtension::Completion completion(const HostMethodsContext& context, const Reply& reply) {
    return [reply, &paths = context.paths](const std::optional<KsError>& error) {
        if (error) return answerWithError(*reply, *error, paths);
        reply->result([](std::string& out) { out += "{}"; });
    };
}

/// The completion, with something that lives until it has been called.
TesselExtension::ItemCompletion keepingUntilAnswered(TesselExtension::ItemCompletion completion,
                                                     std::shared_ptr<const ImportStaging> kept) {
    return [completion = std::move(completion), kept = std::move(kept)](const ItemResult& item) { completion(item); };
}

/// Keeps the answer of an operation that is quicker than whoever is to follow it, so that much work is always told of.
class HeldAnswer {
public:
    void give(std::function<void()> answer) {
        {
            const MutexLock lock(mutex_);
            if (!isFollowed_) {
                held_ = std::move(answer);
                return;
            }
        }
        answer();
    }
    void letGo() {
        std::function<void()> held;
        {
            const MutexLock lock(mutex_);
            isFollowed_ = true;
            held.swap(held_);
        }
        if (held) held();
    }

private:
    Mutex mutex_;
    bool isFollowed_ GUARDED_BY(mutex_) = false;
    std::function<void()> held_ GUARDED_BY(mutex_);
};

/// Starts an operation, `start`, with a completion that answers by `answer`, and follows its progress.
template <typename Value, typename Start>
void follow(const Reply& reply, std::function<void(Value)> answer, const Start& start) {
    const auto held = std::make_shared<HeldAnswer>();
    const auto progress = start([held, answer = std::move(answer)](const std::decay_t<Value>& value) {
        held->give([answer, value] { answer(value); });
    });
    ProgressNotifier::follow(progress, reply);
    held->letGo();
}

void importDocument(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto url = given.urlOrPath();
    const auto parent = url ? given.string("parent") : std::nullopt;
    if (!parent) return;
    follow(reply, itemCompletion(context, reply), [&](TesselExtension::ItemCompletion completion) {
        return context.client.provider().importDocumentAtURL(context.paths.presentedURL(*url), *parent,
                                                             std::move(completion));
    });
}

/// The copy is built where it does not show, then moved to its place under its name: that is taken last, and nothing is
/// to be taken back where somebody else has it.
void copyItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    const auto parent = identifier ? given.string("parent") : std::nullopt;
    std::optional<std::string> name;
    if (!parent || !given.optionalString("name", name)) return;
    auto& provider = context.client.provider();
    const auto source = provider.itemForIdentifier(*identifier);
    if (!source.ok()) return answerWithError(*reply, source.error(), context.paths);
    const KsURL* url = (*source)->fileURL();
    if (url == nullptr) return answerWithError(*reply, KsError::posix(ENOTSUP), context.paths);
    auto made = ImportStaging::make(provider, context.paths);
    if (!made.ok()) return answerWithError(*reply, made.error(), context.paths);
    const auto staging = std::make_shared<const ImportStaging>(*std::move(made));

    const auto move = [&context, reply, staging, parent = *parent,
                       name = name.value_or((*source)->filename())](const ItemResult& built) {
        if (!built.ok()) return answerWithError(*reply, built.error(), context.paths);
        follow(reply, keepingUntilAnswered(itemCompletion(context, reply), staging),
               [&](TesselExtension::ItemCompletion completion) {
                   return context.client.provider().reparentItemWithIdentifier((*built)->itemIdentifier(), parent, name,
                                                                               std::move(completion));
               });
    };
    follow(reply, std::function<void(ItemResult)>(move), [&](TesselExtension::ItemCompletion completion) {
        return provider.importDocumentAtURL(*url, staging->identifier, std::move(completion));
    });
}

void createDirectory(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto name = given.filename();
    const auto parent = name ? given.string("parent") : std::nullopt;
    if (!parent) return;
    context.client.provider().createDirectoryWithName(*name, *parent, itemCompletion(context, reply));
}

void renameItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    const auto name = identifier ? given.filename() : std::nullopt;
    if (!name) return;
    context.client.provider().renameItemWithIdentifier(*identifier, *name, itemCompletion(context, reply));
}

void reparentItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    const auto parent = identifier ? given.string("parent") : std::nullopt;
    std::optional<std::string> name;
    if (!parent || !given.optionalFilename(name)) return;
    follow(reply, itemCompletion(context, reply), [&](TesselExtension::ItemCompletion completion) {
        return context.client.provider().reparentItemWithIdentifier(*identifier, *parent, name, std::move(completion));
    });
}

void deleteItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto identifier = RequestParams(params, *reply).string("identifier");
    if (!identifier) return;
    follow(reply, completion(context, reply), [&](TesselExtension::Completion completion) {
        return context.client.provider().deleteItemWithIdentifier(*identifier, std::move(completion));
    });
}

void trashItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto identifier = RequestParams(params, *reply).string("identifier");
    if (!identifier) return;
    context.client.provider().trashItemWithIdentifier(*identifier, itemCompletion(context, reply));
}

void untrashItem(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    std::optional<std::string> parent;
    if (!identifier || !given.optionalString("parent", parent)) return;
    follow(reply, itemCompletion(context, reply), [&](TesselExtension::ItemCompletion completion) {
        return context.client.provider().untrashItemWithIdentifier(*identifier, parent, std::move(completion));
    });
}

void removeTrashedItemsOlderThan(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const auto date = RequestParams(params, *reply).date("date");
    if (!date) return;
    context.client.provider().removeTrashedItemsOlderThanDate(*date, completion(context, reply));
}

void setLastUsedDate(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    if (!identifier) return;
    const auto date = given.isNull("date") ? std::nullopt : given.date("date");
    if (!date && !given.isNull("date")) return;
    context.client.provider().setLastUsedDate(date, *identifier, itemCompletion(context, reply));
}

void setTags(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    auto labels = identifier ? given.strings("tags") : std::nullopt;
    if (!labels) return;
    std::vector<TSTag> tags;
    tags.reserve(labels->size());
    for (std::string& label : *labels) tags.push_back({std::move(label)});
    context.client.provider().setTagData(tsTagsData(tags), *identifier, itemCompletion(context, reply));
}

void setFavoriteRank(const HostMethodsContext& context, const Json& params, const Reply& reply) {
    const RequestParams given(params, *reply);
    const auto identifier = given.string("identifier");
    if (!identifier) return;
    const auto rank = given.isNull("rank") ? std::nullopt : given.integer("rank");
    if (!rank && !given.isNull("rank")) return;
    context.client.provider().setFavoriteRank(rank, *identifier, itemCompletion(context, reply));
}

}  // namespace

JsonRpcServer::Methods makeEditMethods(const HostMethodsContext& context) {
    constexpr HostMethod kMethods[] = {
        {"importDocument", importDocument},
        {"copyItem", copyItem},
        {"createDirectory", createDirectory},
        {"renameItem", renameItem},
        {"reparentItem", reparentItem},
        {"deleteItem", deleteItem},
        {"trashItem", trashItem},
        {"untrashItem", untrashItem},
        {"removeTrashedItemsOlderThan", removeTrashedItemsOlderThan},
        {"setLastUsedDate", setLastUsedDate},
        {"setTags", setTags},
        {"setFavoriteRank", setFavoriteRank},
    };
    return bindHostMethods(context, kMethods);
}

}  // namespace cindral
