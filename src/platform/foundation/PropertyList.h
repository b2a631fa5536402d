#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// Levels of a property list in its binary form: a scalar has one, an array of scalars two.
inline constexpr unsigned kPropertyListDepthMax = 128;

/// Values that a binary property list may unfold to, each counted once for every reference to it; a text or data counts
/// as one more for every 16 of its bytes. A list of more bytes than this may unfold to as many values as it has bytes,
/// which nothing that encodeBinary() writes can reach.
inline constexpr std::uint64_t kPropertyListValuesMax = 16'384;

/// A value of a property list: bool, integer (signed or unsigned 64 bits), real, date, data, string, array
/// or dictionary with string keys.
///
/// Strings are bytes, UTF-8 by custom: what is not valid UTF-8 comes through the binary form unharmed. Dates keep what
/// a double of seconds since 2001 can hold, 0.12 µs until 2069: docs/property-list.md.
///
/// Thread safety: a value.
class PropertyList {
public:
    using Array = std::vector<PropertyList>;
    using Dictionary = std::map<std::string, PropertyList, std::less<>>;

    PropertyList() : value_(false) {}
    PropertyList(bool value) : value_(value) {}                      // NOLINT(google-explicit-constructor)
    PropertyList(std::int64_t value);                                // NOLINT(google-explicit-constructor)
    PropertyList(std::uint64_t value) : value_(value) {}             // NOLINT(google-explicit-constructor)
    PropertyList(double value) : value_(value) {}                    // NOLINT(google-explicit-constructor)
    PropertyList(KsDate value) : value_(value) {}                    // NOLINT(google-explicit-constructor)
    PropertyList(Bytes value) : value_(std::move(value)) {}          // NOLINT(google-explicit-constructor)
    PropertyList(std::string value) : value_(std::move(value)) {}    // NOLINT(google-explicit-constructor)
    PropertyList(const char* value) : value_(std::string(value)) {}  // NOLINT(google-explicit-constructor)
    PropertyList(Array value) : value_(std::move(value)) {}          // NOLINT(google-explicit-constructor)
    PropertyList(Dictionary value) : value_(std::move(value)) {}     // NOLINT(google-explicit-constructor)

    /// The value as that type, or null. A non-negative integer is always held unsigned.
    const bool* boolean() const { return std::get_if<bool>(&value_); }
    const std::uint64_t* unsignedInteger() const { return std::get_if<std::uint64_t>(&value_); }
    const std::int64_t* negativeInteger() const { return std::get_if<std::int64_t>(&value_); }
    const double* real() const { return std::get_if<double>(&value_); }
    const KsDate* date() const { return std::get_if<KsDate>(&value_); }
    const Bytes* data() const { return std::get_if<Bytes>(&value_); }
    const std::string* string() const { return std::get_if<std::string>(&value_); }
    const Array* array() const { return std::get_if<Array>(&value_); }
    const Dictionary* dictionary() const { return std::get_if<Dictionary>(&value_); }
    /// The value of a key of a dictionary; null when there is none or this is no dictionary.
    const PropertyList* find(std::string_view key) const;

    /// The binary form: docs/property-list.md. Equal values have equal bytes.
    ///
    /// Aborts when the value has more than kPropertyListDepthMax levels: only a wrong program makes one.
    Bytes encodeBinary() const;
    /// Reads the binary form.
    ///
    /// EINVAL (POSIX domain) with a message for anything malformed: every offset, length and reference is checked
    /// before it is used; cycles, nesting beyond kPropertyListDepthMax and references that would unfold to more
    /// values than kPropertyListValuesMax allows are refused, so that no input costs more than a small multiple of its
    /// size.
    static Result<PropertyList> decodeBinary(ByteView bytes);

    friend bool operator==(const PropertyList&, const PropertyList&) = default;

private:
    std::variant<bool, std::uint64_t, std::int64_t, double, KsDate, Bytes, std::string, Array, Dictionary> value_;
};

}  // namespace cindral
