#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/imaging/IconImage.h"

namespace cindral {

/// The type of the images that are written.
inline constexpr std::string_view kPngTypeIdentifier = "image/png";

/// Writes images into a buffer.
///
/// Thread safety: for one thread at a time.
class ImageDestination {
public:
    /// `data` is borrowed for life; it is written to by finalize() alone. Null for a type that can't be written, and for
    /// another number of images than the type holds: PNG holds one.
    static std::unique_ptr<ImageDestination> create(Bytes& data, std::string_view typeIdentifier, std::size_t count);

    /// Takes the next image. What is beyond the number given is dropped.
    void addImage(IconImage image);
    /// False when not all images were added, or one can't be written; the buffer is then empty.
    bool finalize();

private:
    explicit ImageDestination(Bytes& data) : data_(data) {}

    Bytes& data_;
    std::vector<IconImage> images_;
};

}  // namespace cindral
