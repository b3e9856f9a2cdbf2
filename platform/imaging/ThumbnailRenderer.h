#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// Turns the bytes of an image file into a small PNG. An interface so that tests can count,
// block or fail the (slow, library-backed) decoding; PixbufThumbnailRenderer is the real one.
// Implementations must be callable from several threads at once.
class ThumbnailRenderer {
public:
    using TextChunks = std::vector<std::pair<std::string, std::string>>;

    virtual ~ThumbnailRenderer() = default;

    // Decodes `source`, scales it to fit within `edge` x `edge` pixels keeping its aspect ratio
    // (never enlarging it) and encodes it as PNG carrying each of `text` as a tEXt chunk. An
    // error, never a crash, for bytes that are not an image the renderer can read.
    virtual Result<Bytes> render(const Bytes& source, int edge, const TextChunks& text) = 0;
};

}  // namespace tamber
