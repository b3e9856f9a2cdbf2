// Feeds arbitrary bytes to the icon decoder. Whatever decodes must encode as PNG, and that PNG
// must decode to the same pixels.
#include <cstdint>
#include <cstdlib>
#include <memory>

#include "platform/imaging/IconBitmap.h"
#include "platform/imaging/ImageEncoder.h"

using namespace tamber;

namespace {

void check(bool condition) {
    if (!condition)
        std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    ImageRef image = CreateIconFromCachedBitmap(Bytes(data, data + size));
    if (!image)
        return 0;
    check(image->width() <= kMaxIconSide && image->height() <= kMaxIconSide);
    check(image->pixels().size() == size_t(image->width()) * image->height() * 4);
    auto buffer = std::make_shared<Bytes>();
    auto encoder = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    check(encoder != nullptr);
    encoder->addImage(image);
    check(encoder->finalize());
    ImageRef again = CreateIconFromCachedBitmap(*buffer);
    check(again && again->width() == image->width() && again->height() == image->height() &&
          again->pixels() == image->pixels());
    return 0;
}
