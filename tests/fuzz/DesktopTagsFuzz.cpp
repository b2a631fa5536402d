// Tags of the desktop: what is read is text without commas, each label once, and written it reads the same.

#include <cstdlib>
#include <set>

#include "platform/foundation/Utf8.h"
#include "provider/DesktopTags.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto labels = desktop_tags::decode(std::as_bytes(std::span(data, size)));
    if (!labels) return 0;
    if (labels->empty()) std::abort();
    for (const std::string& label : *labels) {
        if (label.empty() || label.find(',') != std::string::npos || !isUtf8(label)) std::abort();
    }
    if (std::set(labels->begin(), labels->end()).size() != labels->size()) std::abort();
    const auto written = desktop_tags::encode(*labels);
    if (!written || desktop_tags::decode(*written) != labels) std::abort();
    return 0;
}
