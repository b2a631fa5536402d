#include "platform/imaging/ImageDestination.h"

#include <png.h>

#include <utility>

namespace cindral {

std::unique_ptr<ImageDestination> ImageDestination::create(Bytes& data, std::string_view typeIdentifier,
                                                           std::size_t count) {
    if (typeIdentifier != kPngTypeIdentifier || count != 1) return nullptr;
    return std::unique_ptr<ImageDestination>(new ImageDestination(data));
}

void ImageDestination::addImage(IconImage image) {
    if (images_.empty()) images_.push_back(std::move(image));
}

bool ImageDestination::finalize() {
    data_.clear();
    if (images_.size() != 1) return false;
    const IconImage& image = images_.front();
    if (image.width == 0 || image.height == 0 || image.width > kIconSideMax || image.height > kIconSideMax ||
        image.pixels.size() != std::size_t{image.width} * image.height * 4) {
        return false;
    }
    png_image head{};
    head.version = PNG_IMAGE_VERSION;
    head.width = image.width;
    head.height = image.height;
    head.format = PNG_FORMAT_RGBA;
    png_alloc_size_t size = 0;
    const auto write = [&](void* memory) {
        return png_image_write_to_memory(&head, memory, &size, 0, image.pixels.data(), 0, nullptr) != 0;
    };
    // Once to hear the size, once to write.
    if (!write(nullptr)) return false;
    data_.resize(size);
    if (!write(data_.data())) {
        data_.clear();
        return false;
    }
    data_.resize(size);
    return true;
}

}  // namespace cindral
