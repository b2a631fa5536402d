#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace cindral {

/// What is answered before the body, and the body where it is short.
///
/// Thread safety: a value.
struct HttpResponse {
    int status = 200;
    std::string contentType = "application/json";
    std::string body;
    /// Beside those that every answer has. Values are the program's own, never a client's.
    std::vector<std::pair<std::string, std::string>> fields;
    std::string contentPolicy;  ///< the page's own where it is empty

    /// An error, as JSON with a line for people.
    static HttpResponse refusal(int status, std::string_view message);
    static HttpResponse json(std::string body);
    static HttpResponse noContent();

    /// The status line and all fields, with the empty line. `length` is the body's; none for a body that goes on until
    /// the connection ends.
    ///
    /// Every answer says that it is of the type that it says, is nobody else's to read, to frame or to keep, and tells
    /// no other site where it came from.
    std::string head(std::optional<std::uint64_t> length, bool keepsConnection) const;
};

}  // namespace cindral
