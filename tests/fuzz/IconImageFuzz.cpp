// A picture that can be read has as many pixels as it says, also scaled down, and can be written and read again as the
// same. Drawings are read by another process, which is not tried here.

#include <algorithm>
#include <cstdlib>

#include "platform/imaging/IconImage.h"
#include "platform/imaging/ImageDestination.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

namespace {

void check(const IconImage& image) {
    if (image.pixels.size() != std::size_t{image.width} * image.height * 4) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto image = decodePng(std::as_bytes(std::span(data, size)));
    if (!image.ok()) return 0;
    check(*image);
    const IconImage small = scaledDown(*image, 48);
    check(small);
    if (std::max(small.width, small.height) > 48) std::abort();
    Bytes written;
    const auto destination = ImageDestination::create(written, kPngTypeIdentifier, 1);
    destination->addImage(small);
    if (!destination->finalize()) std::abort();
    const auto again = decodePng(written);
    if (!again.ok() || again->pixels != small.pixels) std::abort();
    return 0;
}
