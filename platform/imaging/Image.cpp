#include "platform/imaging/Image.h"

namespace tamber {

Image::Image(uint32_t width, uint32_t height, Bytes rgba)
    : width_(width), height_(height), pixels_(std::move(rgba)) {}

std::shared_ptr<const Image> Image::make(uint32_t width, uint32_t height, Bytes rgba) {
    if (width == 0 || height == 0 || rgba.size() / 4 / width != height ||
        rgba.size() != uint64_t(width) * height * 4)
        return nullptr;
    return std::make_shared<const Image>(width, height, std::move(rgba));
}

}  // namespace tamber
