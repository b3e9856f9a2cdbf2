#pragma once

#include <cstdint>

#include "platform/imaging/ThumbnailRenderer.h"

namespace tamber {

// Renders thumbnails with gdk-pixbuf: reads whatever formats its installed loaders read (PNG,
// JPEG, GIF, WebP, BMP, TIFF...), honours an embedded orientation, and writes PNG.
// An image of more than kMaxPixels is refused (EFBIG) from its header, before its pixels are
// allocated: a small file can claim a picture that takes gigabytes to decode.
class PixbufThumbnailRenderer : public ThumbnailRenderer {
public:
    static constexpr int64_t kMaxPixels = 64ll << 20;

    Result<Bytes> render(const Bytes& source, int edge, const TextChunks& text) override;
};

}  // namespace tamber
