#pragma once

#include <string>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"
#include "platform/imaging/IconImage.h"

namespace cindral {

/// Draws an SVG so that it fits a square of `pixels`, in a process of its own ("cindral-render-svg") that is started for
/// it: what is drawn may be hostile, and that process can neither open nor reach anything but its two ends of a pipe, and
/// is ended when it takes too much memory or time.
///
/// EINVAL for what is no SVG, is broken, or was too much; ETIMEDOUT when it took too long; ENOENT where the program is
/// not installed.
Result<IconImage> renderSvg(ByteView data, unsigned pixels);

/// Where the program is: the one given, else beside this one, else where it is installed to. Empty when it is nowhere.
std::string svgRendererProgram();
/// For tests. Empty takes it back.
void setSvgRendererProgram(std::string path);

}  // namespace cindral
