#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace cindral {

/// What a browser asks for: everything before the body.
///
/// Thread safety: a value.
struct HttpRequest {
    enum class Method { get, head, post, other };

    Method method = Method::other;
    std::string path;                                         ///< as sent, still percent-encoded; begins with "/"
    std::string query;                                        ///< as sent, without the "?"
    std::vector<std::pair<std::string, std::string>> fields;  ///< names in lower case, in the order in which they came
    std::optional<std::uint64_t> contentLength;
    bool isChunked = false;

    bool hasBody() const { return isChunked || contentLength.value_or(0) > 0; }
    std::size_t count(std::string_view name) const;
    /// The value of a field that stands there exactly once; none for any other.
    std::optional<std::string_view> only(std::string_view name) const;
    /// A parameter of the query, decoded; none where it is missing, stands there twice or can't be decoded.
    std::optional<std::string> parameter(std::string_view name) const;
    /// The value of each cookie of that name.
    std::vector<std::string_view> cookies(std::string_view name) const;
};

/// Each %XX as its byte, once; none where a "%" is followed by anything else.
std::optional<std::string> percentDecode(std::string_view text);

}  // namespace cindral
