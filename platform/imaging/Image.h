#pragma once

#include <cstdint>
#include <memory>

#include "platform/objects/Data.h"

namespace tamber {

// A decoded bitmap: 8-bit RGBA, not premultiplied, rows top to bottom without padding.
// Immutable.
class Image {
public:
    // Nothing unless both sides are at least 1 and `rgba` holds exactly width * height * 4
    // bytes.
    static std::shared_ptr<const Image> make(uint32_t width, uint32_t height, Bytes rgba);

    uint32_t width() const { return width_; }
    uint32_t height() const { return height_; }
    const Bytes& pixels() const { return pixels_; }

    Image(uint32_t width, uint32_t height, Bytes rgba);

private:
    uint32_t width_;
    uint32_t height_;
    Bytes pixels_;
};

using ImageRef = std::shared_ptr<const Image>;

}  // namespace tamber
