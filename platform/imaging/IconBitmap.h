#pragma once

#include "platform/imaging/Image.h"
#include "platform/objects/Data.h"

namespace tamber {

// The largest side an icon bitmap may have. Icons are at most a few hundred pixels; the limit
// keeps a hostile header from asking for gigabytes.
inline constexpr uint32_t kMaxIconSide = 2048;

// Decodes icon data (a PNG file, as the icon theme holds them: any bit depth, palette, grey or
// colour, with or without alpha, interlaced or not) into an RGBA bitmap. Nothing for data that
// is not a complete, valid PNG, or that is larger than kMaxIconSide on a side; never crashes on
// hostile bytes.
ImageRef CreateIconFromCachedBitmap(const Bytes& bytes);

}  // namespace tamber
