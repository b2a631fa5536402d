#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// A picture in memory: rows of pixels from the top, four bytes each (red, green, blue, opacity), colours not
/// multiplied with the opacity.
///
/// Thread safety: a value.
struct IconImage {
    unsigned width = 0;
    unsigned height = 0;
    std::vector<std::uint8_t> pixels;
};

/// Pixels of a side that a picture may have. What has more is no icon, and would cost the memory of many.
inline constexpr unsigned kIconSideMax = 2048;

/// The icon service: turns the contents of an icon's file, PNG or SVG, into a picture whose longer side has `pixels` at
/// most. Pictures are scaled down, never up; drawings are drawn to fit.
///
/// The contents may be hostile. A PNG is refused by its head before it costs memory; an SVG is drawn by a process that
/// can reach nothing but the pipe to this one, and is given little memory and time. EINVAL for what is no such file or
/// is broken, EFBIG for too large a picture, ETIMEDOUT, and the errors of starting a process.
Result<IconImage> iconImageFromData(ByteView data, unsigned pixels);

/// The parts of it.
bool isPng(ByteView data);
Result<IconImage> decodePng(ByteView data);
/// Averages over the pixels that fall together, each counted by its opacity.
IconImage scaledDown(const IconImage& image, unsigned pixels);

}  // namespace cindral
