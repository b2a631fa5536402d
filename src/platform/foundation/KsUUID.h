#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace cindral {

/// A universally unique identifier, 16 bytes in network order.
///
/// Thread safety: a value.
struct KsUUID {
    std::array<std::uint8_t, 16> bytes{};

    /// A random one (version 4), from the kernel's generator.
    static KsUUID random();
    /// Canonical upper-case 8-4-4-4-12 form.
    std::string string() const;
    /// Reads the 8-4-4-4-12 form in either case; none for anything else.
    static std::optional<KsUUID> parse(std::string_view text);

    friend auto operator<=>(const KsUUID&, const KsUUID&) = default;
};

}  // namespace cindral
