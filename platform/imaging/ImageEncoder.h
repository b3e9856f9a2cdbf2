#pragma once

#include <cstddef>
#include <memory>
#include <string_view>

#include "platform/imaging/Image.h"
#include "platform/objects/Data.h"

namespace tamber {

// Writes images into a byte buffer in an image file format. PNG is the one format: a PNG file
// holds exactly one image. Use: create, addImage once per image, finalize. Not thread-safe.
class ImageEncoder {
public:
    static constexpr std::string_view kPNGType = "public.png";

    // An encoder that will append `count` images of type `type` to `buffer`; nothing when the
    // buffer is null, the type is not PNG, or the count is not 1.
    static std::shared_ptr<ImageEncoder> create(std::shared_ptr<Bytes> buffer,
                                                std::string_view type, size_t count);

    // Queues an image; images past the announced count, and null images, make finalize fail.
    void addImage(const ImageRef& image);

    // Encodes the queued images and appends them to the buffer. False, with the buffer
    // unchanged, when the images do not match the announced count, encoding failed, or the
    // encoder was already finalized.
    bool finalize();

    ImageEncoder(std::shared_ptr<Bytes> buffer, size_t count);

private:
    std::shared_ptr<Bytes> buffer_;
    size_t count_;
    size_t added_ = 0;
    ImageRef image_;
    bool finalized_ = false;
};

}  // namespace tamber
