#pragma once

#include <compare>
#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace cindral {

/// A moment: seconds since 1970-01-01 00:00 UTC, and nanoseconds within the second.
///
/// Thread safety: a value.
struct KsDate {
    std::int64_t seconds = 0;
    std::uint32_t nanoseconds = 0;  ///< 0 to 999,999,999, always counted forward from `seconds`

    static KsDate now();
    static KsDate from(const timespec& time);

    /// RFC 3339 in UTC, "2026-11-20T09:52:00.000000001Z", without trailing zeros of the fraction (and without
    /// a fraction when it is zero). Years before 0 and after 9999 are written with as many digits as they have
    /// and their sign.
    std::string rfc3339() const;
    void appendRFC3339(std::string& out) const;
    /// Reads RFC 3339 with any offset and up to nine decimals; none for anything else.
    static std::optional<KsDate> parseRFC3339(std::string_view text);

    friend auto operator<=>(const KsDate&, const KsDate&) = default;
};

}  // namespace cindral
