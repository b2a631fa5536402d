#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace cindral {

using Json = nlohmann::json;

inline constexpr std::size_t kJsonRpcLineBytesMax = 16 << 20;
inline constexpr std::size_t kJsonRpcDepthMax = 64;
/// Values in one line, about: what a line unfolds to in memory is bounded by this, not by its bytes.
inline constexpr std::size_t kJsonRpcValuesMax = 1'000'000;
inline constexpr std::size_t kJsonRpcBatchRequestsMax = 10'000;

/// JSON-RPC's own codes. Part of the host interface.
enum class JsonRpcCode : std::int64_t {
    parseError = -32700,
    invalidRequest = -32600,
    methodNotFound = -32601,
    invalidParams = -32602,
    internalError = -32603,
    operationFailed = -32000,  ///< with "data" that says what and why
};

/// A call that is well formed; whether there is such a method is not known yet.
struct JsonRpcRequest {
    std::string method;
    Json params;     ///< an object; an array where they were given by position
    std::string id;  ///< as JSON text; empty for a notification, which is not answered
    bool isNotification() const { return id.empty(); }
};

/// What a line holds in place of a request, and is to be told so.
struct JsonRpcFault {
    JsonRpcCode code{};
    std::string message;
    std::string id = "null";  ///< as JSON text
};

using JsonRpcEntry = std::variant<JsonRpcRequest, JsonRpcFault>;

/// What one line holds.
struct JsonRpcLine {
    bool isBatch = false;
    std::vector<JsonRpcEntry>
        entries;  ///< one where this is no batch; none for a line of white space, which is no message
};

/// Reads one line.
///
/// No line can exhaust the process: nesting and the number of values are checked before anything is built. An id is
/// a string, a number that can be echoed exactly (integers of 64 bits, signed or unsigned; fractions), or null. Of a
/// key that stands twice in an object the last one counts.
///
/// Thread safety: a function without state.
JsonRpcLine decodeJsonRpcLine(std::string_view line);

/// Whether the text is nested deeper than that, or holds more values, brackets in strings not counted. The text need
/// not be JSON.
bool isJsonTooComplex(std::string_view text, std::size_t depthMax, std::size_t valuesMax);

/// The id as it is to be echoed, as JSON text; none where it is of a kind that no id is, or can't be echoed exactly.
std::optional<std::string> jsonRpcIDText(const Json& id);

/// One answer as JSON text, without a newline.
std::string encodeJsonRpcFault(const JsonRpcFault& fault);

}  // namespace cindral
