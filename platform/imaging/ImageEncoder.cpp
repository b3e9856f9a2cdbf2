#include "platform/imaging/ImageEncoder.h"

#include <png.h>

namespace tamber {

std::shared_ptr<ImageEncoder> ImageEncoder::create(std::shared_ptr<Bytes> buffer,
                                                   std::string_view type, size_t count) {
    if (!buffer || type != kPNGType || count != 1)
        return nullptr;
    return std::make_shared<ImageEncoder>(std::move(buffer), count);
}

ImageEncoder::ImageEncoder(std::shared_ptr<Bytes> buffer, size_t count)
    : buffer_(std::move(buffer)), count_(count) {}

void ImageEncoder::addImage(const ImageRef& image) {
    if (added_++ == 0)
        image_ = image;
}

bool ImageEncoder::finalize() {
    if (finalized_)
        return false;
    finalized_ = true;
    if (added_ != count_ || !image_)
        return false;

    png_image image{};
    image.version = PNG_IMAGE_VERSION;
    image.width = image_->width();
    image.height = image_->height();
    image.format = PNG_FORMAT_RGBA;
    // First ask for the size, then write into the end of the buffer.
    png_alloc_size_t size = 0;
    if (!png_image_write_to_memory(&image, nullptr, &size, 0, image_->pixels().data(), 0,
                                   nullptr) ||
        size == 0)
        return false;
    size_t start = buffer_->size();
    buffer_->resize(start + size);
    if (!png_image_write_to_memory(&image, buffer_->data() + start, &size, 0,
                                   image_->pixels().data(), 0, nullptr)) {
        buffer_->resize(start);
        return false;
    }
    buffer_->resize(start + size);
    return true;
}

}  // namespace tamber
