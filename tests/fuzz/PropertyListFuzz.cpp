// What decodes, encodes and decodes again to the same value and the same bytes.

#include <cstdlib>

#include "platform/foundation/PropertyList.h"

using cindral::Bytes;
using cindral::PropertyList;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto list = PropertyList::decodeBinary(std::as_bytes(std::span(data, size)));
    if (!list) return 0;
    const Bytes written = list->encodeBinary();
    const auto again = PropertyList::decodeBinary(written);
    if (!again) std::abort();
    const bool holdsNoNumber = !(*list == *list);  // A real that is not a number equals nothing, itself included.
    if (!holdsNoNumber && !(*again == *list)) std::abort();
    if (again->encodeBinary() != written) std::abort();
    return 0;
}
