#include "platform/imaging/IconImage.h"

#include <png.h>

#include <algorithm>
#include <array>
#include <cerrno>

#include "platform/imaging/SvgRenderer.h"

namespace cindral {
namespace {

constexpr std::array<std::uint8_t, 8> kPngSignature{0x89, 'P', 'N', 'G', '\r', '\n', 0x1A, '\n'};

/// What the library holds for one picture, let go of whatever happens.
struct PngReader {
    PngReader() { image.version = PNG_IMAGE_VERSION; }
    ~PngReader() { png_image_free(&image); }
    PngReader(const PngReader&) = delete;
    PngReader& operator=(const PngReader&) = delete;

    png_image image{};
};

/// How much of the pixel `index` of a row is covered by the span [begin, end), in pixels.
double coverage(unsigned index, double begin, double end) {
    return std::max(0.0, std::min(end, index + 1.0) - std::max(begin, static_cast<double>(index)));
}

std::uint8_t byteOf(double value) {
    return static_cast<std::uint8_t>(std::clamp(value + 0.5, 0.0, 255.0));
}

void averagePixel(const IconImage& from, double left, double right, double top, double bottom, std::uint8_t* out) {
    double sums[3] = {};
    double opacity = 0;
    double area = 0;
    for (auto y = static_cast<unsigned>(top); y < from.height && y < bottom; ++y) {
        const double rows = coverage(y, top, bottom);
        for (auto x = static_cast<unsigned>(left); x < from.width && x < right; ++x) {
            const double weight = rows * coverage(x, left, right);
            const std::uint8_t* pixel = from.pixels.data() + (std::size_t{y} * from.width + x) * 4;
            for (int i = 0; i < 3; ++i) sums[i] += weight * pixel[3] * pixel[i];
            opacity += weight * pixel[3];
            area += weight;
        }
    }
    for (int i = 0; i < 3; ++i) out[i] = opacity > 0 ? byteOf(sums[i] / opacity) : 0;
    out[3] = area > 0 ? byteOf(opacity / area) : 0;
}

}  // namespace

bool isPng(ByteView data) {
    return data.size() >= kPngSignature.size() &&
           std::ranges::equal(data.first(kPngSignature.size()), std::as_bytes(std::span(kPngSignature)));
}

Result<IconImage> decodePng(ByteView data) {
    PngReader reader;
    if (png_image_begin_read_from_memory(&reader.image, data.data(), data.size()) == 0) return KsError::posix(EINVAL);
    if (reader.image.width > kIconSideMax || reader.image.height > kIconSideMax) return KsError::posix(EFBIG);
    reader.image.format = PNG_FORMAT_RGBA;
    IconImage image{reader.image.width, reader.image.height, {}};
    image.pixels.resize(PNG_IMAGE_SIZE(reader.image));
    if (png_image_finish_read(&reader.image, nullptr, image.pixels.data(), 0, nullptr) == 0)
        return KsError::posix(EINVAL);
    return image;
}

IconImage scaledDown(const IconImage& image, unsigned pixels) {
    const unsigned side = std::max(image.width, image.height);
    if (side <= pixels || pixels == 0) return image;
    const double factor = static_cast<double>(side) / pixels;
    const auto scaled = [factor](unsigned length) {
        return std::max(1U, static_cast<unsigned>(static_cast<double>(length) / factor + 0.5));
    };
    IconImage out{scaled(image.width), scaled(image.height), {}};
    out.pixels.resize(std::size_t{out.width} * out.height * 4);
    const double stepX = static_cast<double>(image.width) / out.width;
    const double stepY = static_cast<double>(image.height) / out.height;
    for (unsigned y = 0; y < out.height; ++y) {
        for (unsigned x = 0; x < out.width; ++x) {
            averagePixel(image, x * stepX, (x + 1) * stepX, y * stepY, (y + 1) * stepY,
                         out.pixels.data() + (std::size_t{y} * out.width + x) * 4);
        }
    }
    return out;
}

Result<IconImage> iconImageFromData(ByteView data, unsigned pixels) {
    if (pixels == 0 || pixels > kIconSideMax) return KsError::posix(EINVAL);
    if (!isPng(data)) return renderSvg(data, pixels);
    return scaledDown(TRY(decodePng(data)), pixels);
}

}  // namespace cindral
