// A root that can be read can be archived and read again; it is read as one class at most, and as no other.

#include <cstdlib>

#include "platform/foundation/KeyedArchive.h"

using namespace cindral;                 // NOLINT(google-build-using-namespace)
using namespace cindral::keyed_archive;  // NOLINT(google-build-using-namespace)

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const ByteView bytes = std::as_bytes(std::span(data, size));
    const auto root = unarchiveRoot(bytes);
    const auto date = unarchiveDate(bytes);
    const auto string = unarchiveString(bytes);
    const auto strings = unarchiveStrings(bytes);
    const auto integer = unarchiveInteger(bytes);
    if (date.has_value() + string.has_value() + strings.has_value() + integer.has_value() > (root ? 1 : 0))
        std::abort();
    if (date && unarchiveDate(archive(*date)) != date) std::abort();
    if (string && unarchiveString(archive(*string)) != string) std::abort();
    if (strings && unarchiveStrings(archive(PropertyList::Array(strings->begin(), strings->end()))) != strings)
        std::abort();
    if (integer && unarchiveInteger(archive(*integer)) != integer) std::abort();
    if (root) {
        const Bytes written = archive(*root);
        const auto again = unarchiveRoot(written);
        if (!again || archive(*again) != written) std::abort();
    }
    return 0;
}
