#pragma once

#include "platform/imaging/ThumbnailRenderer.h"

namespace tamber {

// Renders thumbnails with gdk-pixbuf: reads whatever formats its installed loaders read (PNG,
// JPEG, GIF, WebP, BMP, TIFF...), honours an embedded orientation, and writes PNG.
class PixbufThumbnailRenderer : public ThumbnailRenderer {
public:
    Result<Bytes> render(const Bytes& source, int edge, const TextChunks& text) override;
};

}  // namespace tamber
