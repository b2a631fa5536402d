#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace cindral {

/// Appends the text as a JSON string, quotes and all.
///
/// Any bytes will do: control characters are escaped, and what is not UTF-8 becomes U+FFFD, one for each maximal
/// subpart.
void appendJsonString(std::string& out, std::string_view text);
std::string jsonString(std::string_view text);

void appendJsonNumber(std::string& out, std::uint64_t value);
void appendJsonNumber(std::string& out, std::int64_t value);

/// Percent-encodes every byte but the unreserved characters and "/".
void appendPercentEncoded(std::string& out, std::string_view path);

}  // namespace cindral
