#include <fmt/format.h>

#include <cstdint>
#include <cstdlib>

#include "host/JsonRpcMessage.h"
#include "host/JsonText.h"

namespace {

using namespace cindral;

void require(bool holds) {
    if (!holds) std::abort();
}

/// An id comes back as JSON of a kind that an id may be.
void checkID(const std::string& id) {
    const Json value = Json::parse(id, nullptr, /*allow_exceptions=*/false);
    require(value.is_string() || value.is_number() || value.is_null());
}

/// What decodes, encodes and decodes again to the same request.
void checkRequest(const JsonRpcRequest& request) {
    require(request.params.is_structured());
    if (!request.isNotification()) checkID(request.id);
    const std::string id = request.isNotification() ? "" : R"("id":)" + request.id + ",";
    const std::string line = fmt::format(R"({{"jsonrpc":"2.0",{}"method":{},"params":{}}})", id,
                                         jsonString(request.method), request.params.dump());
    const JsonRpcLine again = decodeJsonRpcLine(line);
    require(!again.isBatch && again.entries.size() == 1);
    const auto* same = std::get_if<JsonRpcRequest>(&again.entries.front());
    require(same != nullptr && same->method == request.method && same->params == request.params &&
            same->id == request.id);
}

/// What is answered is a line of JSON, whatever was asked.
void checkFault(const JsonRpcFault& fault) {
    checkID(fault.id);
    const std::string text = encodeJsonRpcFault(fault);
    require(text.find('\n') == std::string::npos);
    const Json value = Json::parse(text, nullptr, /*allow_exceptions=*/false);
    require(value.is_object() && value["error"]["code"] == static_cast<std::int64_t>(fault.code));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const JsonRpcLine line = decodeJsonRpcLine({reinterpret_cast<const char*>(data), size});
    require(line.isBatch || line.entries.size() <= 1);
    for (const JsonRpcEntry& entry : line.entries) {
        if (const auto* request = std::get_if<JsonRpcRequest>(&entry)) {
            checkRequest(*request);
        } else {
            checkFault(std::get<JsonRpcFault>(entry));
        }
    }
    return 0;
}
