#include "platform/imaging/IconBitmap.h"

#include <png.h>

namespace tamber {

ImageRef CreateIconFromCachedBitmap(const Bytes& bytes) {
    if (bytes.empty())
        return nullptr;
    // libpng's simplified interface: it keeps its error recovery to itself and reports a
    // failure as a zero return, with no longjmp crossing our frames.
    png_image image{};
    image.version = PNG_IMAGE_VERSION;
    if (!png_image_begin_read_from_memory(&image, bytes.data(), bytes.size()))
        return nullptr;
    if (image.width == 0 || image.height == 0 || image.width > kMaxIconSide ||
        image.height > kMaxIconSide) {
        png_image_free(&image);
        return nullptr;
    }
    image.format = PNG_FORMAT_RGBA;
    Bytes pixels(PNG_IMAGE_SIZE(image));
    if (!png_image_finish_read(&image, nullptr, pixels.data(), 0, nullptr)) {
        png_image_free(&image);
        return nullptr;
    }
    return Image::make(image.width, image.height, std::move(pixels));
}

}  // namespace tamber
