#include "host/JsonRpcMessage.h"

#include <fmt/format.h>

#include <cmath>
#include <optional>

#include "host/JsonText.h"

namespace cindral {
namespace {

constexpr double kExactFractionMax = 9'007'199'254'740'992.0;  // 2^53: beyond it a double skips integers.

JsonRpcFault invalidRequest(std::string message, std::string id = "null") {
    return {JsonRpcCode::invalidRequest, std::move(message), std::move(id)};
}

const Json* member(const Json& object, const char* key) {
    const auto found = object.find(key);
    return found != object.end() ? &*found : nullptr;
}

JsonRpcEntry requestOf(Json&& value) {
    if (!value.is_object()) return invalidRequest("A request is an object");

    std::string id;
    if (const Json* given = member(value, "id")) {
        auto echo = jsonRpcIDText(*given);
        if (!echo) return invalidRequest("The id is neither a string, a number of 64 bits nor null");
        id = *std::move(echo);
    }
    const std::string answerID = id.empty() ? "null" : id;

    const Json* version = member(value, "jsonrpc");
    if (version == nullptr || !version->is_string() || *version != "2.0")
        return invalidRequest("\"jsonrpc\" is not \"2.0\"", answerID);
    const Json* method = member(value, "method");
    if (method == nullptr || !method->is_string()) return invalidRequest("\"method\" is not a string", answerID);

    JsonRpcRequest request{method->get<std::string>(), Json::object(), std::move(id)};
    const auto params = value.find("params");
    if (params == value.end()) return request;
    if (!params->is_structured()) return invalidRequest("\"params\" is not an object", answerID);
    request.params = std::move(*params);
    return request;
}

bool isBlank(std::string_view line) {
    return line.find_first_not_of(" \t\r") == std::string_view::npos;
}

JsonRpcLine lineOf(JsonRpcFault fault) {
    JsonRpcLine line;
    line.entries.emplace_back(std::move(fault));
    return line;
}

JsonRpcLine batchOf(Json&& batch) {
    if (batch.empty()) return lineOf(invalidRequest("The batch is empty"));
    if (batch.size() > kJsonRpcBatchRequestsMax) return lineOf(invalidRequest("The batch holds too many requests"));
    JsonRpcLine line;
    line.isBatch = true;
    line.entries.reserve(batch.size());
    for (Json& each : batch) line.entries.push_back(requestOf(std::move(each)));
    return line;
}

}  // namespace

bool isJsonTooComplex(std::string_view text, std::size_t depthMax, std::size_t valuesMax) {
    std::size_t depth = 0;
    std::size_t values = 1;
    bool inString = false;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (inString) {
            if (c == '\\') ++i;
            if (c == '"') inString = false;
            continue;
        }
        switch (c) {
            case '"': inString = true; break;
            case '[':
            case '{':
                if (++depth > depthMax) return true;
                ++values;
                break;
            case ']':
            case '}':
                if (depth > 0) --depth;
                break;
            case ',':
            case ':': ++values; break;
            default: break;
        }
        if (values > valuesMax) return true;
    }
    return false;
}

JsonRpcLine decodeJsonRpcLine(std::string_view line) {
    if (isBlank(line)) return {};
    if (isJsonTooComplex(line, kJsonRpcDepthMax, kJsonRpcValuesMax)) {
        return lineOf(invalidRequest("The message is nested too deeply or holds too many values"));
    }
    // The parser takes a NUL for the end of its input, and would not look at what follows.
    if (line.find('\0') != std::string_view::npos) return lineOf({JsonRpcCode::parseError, "The line is not JSON"});
    // Also refuses what is not UTF-8, and numbers that no double can hold.
    Json value = Json::parse(line, nullptr, /*allow_exceptions=*/false);
    if (value.is_discarded()) return lineOf({JsonRpcCode::parseError, "The line is not JSON"});
    if (value.is_array()) return batchOf(std::move(value));

    JsonRpcLine result;
    result.entries.push_back(requestOf(std::move(value)));
    return result;
}

std::optional<std::string> jsonRpcIDText(const Json& id) {
    if (id.is_string()) return jsonString(id.get_ref<const std::string&>());
    if (id.is_number_float() && !(std::abs(id.get<double>()) < kExactFractionMax)) return std::nullopt;
    if (id.is_number() || id.is_null()) return id.dump();
    return std::nullopt;
}

std::string encodeJsonRpcFault(const JsonRpcFault& fault) {
    return fmt::format(R"({{"jsonrpc":"2.0","id":{},"error":{{"code":{},"message":{}}}}})", fault.id,
                       static_cast<std::int64_t>(fault.code), jsonString(fault.message));
}

}  // namespace cindral
