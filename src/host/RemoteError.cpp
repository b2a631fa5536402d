#include "host/RemoteError.h"

#include <set>
#include <string>
#include <string_view>

#include "host/HostError.h"
#include "host/RemoteItem.h"
#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

/// The same text, for as long as the process lives: there are few domains.
std::string_view lasting(const std::string& text) {
    static Mutex mutex;
    static std::set<std::string> texts;
    const MutexLock lock(mutex);
    return *texts.insert(text).first;
}

std::string textOf(const Json& json, const char* key) {
    const auto found = json.find(key);
    return found != json.end() && found->is_string() ? found->get<std::string>() : "";
}

KsError::UserInfo userInfoOf(const Json& data, const std::string& message) {
    KsError::UserInfo info;
    for (const auto& [key, value] : data.items()) {
        if (key != "domain" && value.is_string()) info.emplace(key, value.get<std::string>());
    }
    // The exact bytes, where the text could not hold them.
    if (const auto found = info.find("pathURL"); found != info.end()) {
        if (const auto url = KsURL::parse(found->second)) info.insert_or_assign("path", url->path());
        info.erase(found);
    }
    info.insert_or_assign("message", message);
    return info;
}

}  // namespace

KsError unreadableAnswer() {
    return hostFailure("the daemon's answer can't be read");
}

KsError errorFromJson(const Json& json) {
    if (!json.is_object()) return unreadableAnswer();
    const std::string message = textOf(json, "message");
    const auto data = json.find("data");
    // One of JSON-RPC's own: the daemon is of another version.
    if (data == json.end() || !data->is_object()) return hostFailure("the daemon refuses the request: " + message);
    const std::string domain = textOf(*data, "domain");
    const auto code = data->find("code");
    if (domain.empty() || code == data->end() || !code->is_number_integer()) return unreadableAnswer();
    if (const auto inTheWay = data->find("item"); inTheWay != data->end()) {
        if (auto item = itemFromJson(*inTheWay); item.ok()) return tesselErrorForCollisionWithItem(*std::move(item));
    }
    return {lasting(domain), code->get<std::int64_t>(), userInfoOf(*data, message)};
}

}  // namespace cindral
