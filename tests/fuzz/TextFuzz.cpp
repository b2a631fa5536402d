// Dates, base64 and identifiers as text: what is read is written as what reads the same, and base64 to the last
// character.

#include <algorithm>
#include <cstdlib>

#include "platform/foundation/Base64.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/KsUUID.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

namespace {

void checkDate(std::string_view text) {
    const auto date = KsDate::parseRFC3339(text);
    if (!date) return;
    if (date->nanoseconds > 999'999'999) std::abort();
    const std::string written = date->rfc3339();
    // An offset may lead out of the years that have four digits.
    const bool fourDigits = written.find('-') == 4;
    if (fourDigits && KsDate::parseRFC3339(written) != date) std::abort();
}

void checkUUID(std::string_view text) {
    const auto uuid = KsUUID::parse(text);
    if (!uuid) return;
    std::string capitals(text);
    std::ranges::transform(capitals, capitals.begin(),
                           [](char c) { return c >= 'a' && c <= 'f' ? static_cast<char>(c - 'a' + 'A') : c; });
    if (uuid->string() != capitals) std::abort();
}

void checkBase64(std::string_view text) {
    const auto bytes = base64Decode(text);
    if (bytes && base64Encode(*bytes) != text) std::abort();
    const auto own = base64Decode(base64Encode(bytesOf(text)));
    if (!own || textOf(*own) != text) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    checkDate(text);
    checkUUID(text);
    checkBase64(text);
    return 0;
}
