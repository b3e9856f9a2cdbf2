#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <random>

#include "platform/imaging/IconBitmap.h"
#include "platform/imaging/ImageEncoder.h"

namespace tamber {
namespace {

Bytes seed(const std::string& name) {
    const char* source = std::getenv("TAMBER_SOURCE_DIR");
    std::string root = source ? source : ".";
    std::ifstream in(root + "/fuzz/seeds/icon_bitmap/" + name, std::ios::binary);
    EXPECT_TRUE(in) << name;
    return Bytes(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::optional<Bytes> encode(const ImageRef& image) {
    auto buffer = std::make_shared<Bytes>();
    auto encoder = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    if (!encoder)
        return std::nullopt;
    encoder->addImage(image);
    if (!encoder->finalize())
        return std::nullopt;
    return *buffer;
}

// A width x height image whose every byte differs from its neighbours.
ImageRef pattern(uint32_t width, uint32_t height) {
    Bytes pixels(size_t(width) * height * 4);
    for (size_t i = 0; i < pixels.size(); ++i) pixels[i] = uint8_t(i * 7 + i / 5);
    return Image::make(width, height, std::move(pixels));
}

TEST(IconBitmapTest, DecodesEveryPngLayoutToRgba) {
    // Colour with alpha, a palette with a transparent entry, 16-bit grey.
    ImageRef rgba = CreateIconFromCachedBitmap(seed("rgba_2x2.png"));
    ASSERT_TRUE(rgba);
    EXPECT_EQ(rgba->width(), 2u);
    EXPECT_EQ(rgba->height(), 2u);
    EXPECT_EQ(rgba->pixels(),
              (Bytes{255, 0, 0, 255, 0, 255, 0, 128, 0, 0, 255, 0, 255, 255, 255, 255}));

    ImageRef palette = CreateIconFromCachedBitmap(seed("palette_3x1.png"));
    ASSERT_TRUE(palette);
    EXPECT_EQ(palette->pixels(), (Bytes{10, 20, 30, 255, 40, 50, 60, 0, 70, 80, 90, 255}));

    ImageRef grey = CreateIconFromCachedBitmap(seed("grey16_1x2.png"));
    ASSERT_TRUE(grey);
    EXPECT_EQ(grey->width(), 1u);
    EXPECT_EQ(grey->height(), 2u);
    EXPECT_EQ(grey->pixels(), (Bytes{255, 255, 255, 255, 0, 0, 0, 255}));
}

TEST(IconBitmapTest, RefusesTruncatedCorruptAndRandomBytes) {
    Bytes good = seed("rgba_2x2.png");
    ASSERT_TRUE(CreateIconFromCachedBitmap(good));
    EXPECT_FALSE(CreateIconFromCachedBitmap({}));
    // Cut anywhere before the end of the image data: refused. A missing trailer after complete
    // image data is tolerated, as by most decoders, and gives the whole image.
    const size_t trailer = 12;  // the IEND chunk
    for (size_t length = 0; length < good.size(); ++length) {
        ImageRef image = CreateIconFromCachedBitmap(Bytes(good.begin(), good.begin() + length));
        if (length < good.size() - trailer)
            EXPECT_FALSE(image) << length;
        else
            EXPECT_TRUE(image && image->pixels() == CreateIconFromCachedBitmap(good)->pixels());
    }
    // Every single-byte change in the header and image data is caught by a check or a CRC.
    for (size_t at = 8; at < good.size() - 12; ++at) {
        Bytes bad = good;
        bad[at] ^= 0x5a;
        EXPECT_FALSE(CreateIconFromCachedBitmap(bad)) << at;
    }
    std::mt19937 random(1234);
    for (int round = 0; round < 300; ++round) {
        Bytes noise(random() % 400);
        for (auto& b : noise) b = uint8_t(random());
        if (round % 2 == 0 && noise.size() >= 8)  // past the signature, into the chunks
            std::copy(good.begin(), good.begin() + 8, noise.begin());
        EXPECT_FALSE(CreateIconFromCachedBitmap(noise));
    }
}

uint32_t crc32(const uint8_t* data, size_t size) {
    uint32_t crc = 0xffffffffu;
    for (size_t i = 0; i < size; ++i) {
        crc ^= data[i];
        for (int bit = 0; bit < 8; ++bit) crc = (crc >> 1) ^ (0xedb88320u & (0u - (crc & 1)));
    }
    return ~crc;
}

TEST(IconBitmapTest, RefusesImagesLargerThanAnIcon) {
    ASSERT_TRUE(CreateIconFromCachedBitmap(*encode(pattern(kMaxIconSide, 1))));
    EXPECT_FALSE(CreateIconFromCachedBitmap(*encode(pattern(kMaxIconSide + 1, 1))));
    EXPECT_FALSE(CreateIconFromCachedBitmap(*encode(pattern(1, kMaxIconSide + 1))));

    // A well-formed header announcing 100000 x 100000 pixels is refused before anything that
    // size is allocated (under AddressSanitizer such an allocation would abort the test).
    Bytes huge = *encode(pattern(1, 1));
    auto storedCrc = [&] {
        return uint32_t(huge[29]) << 24 | uint32_t(huge[30]) << 16 | uint32_t(huge[31]) << 8 |
               huge[32];
    };
    ASSERT_EQ(crc32(huge.data() + 12, 17), storedCrc()) << "the header is where we expect it";
    for (size_t at : {16u, 20u}) {
        huge[at] = 0, huge[at + 1] = 0x01, huge[at + 2] = 0x86, huge[at + 3] = 0xa0;
    }
    uint32_t crc = crc32(huge.data() + 12, 17);  // the IHDR chunk's type and data
    for (int i = 0; i < 4; ++i) huge[29 + i] = uint8_t(crc >> (24 - 8 * i));
    ASSERT_EQ(storedCrc(), crc);
    EXPECT_FALSE(CreateIconFromCachedBitmap(huge));
}

TEST(ImageEncoderTest, RoundTripsPixelsExactly) {
    for (auto [w, h] : {std::pair{1u, 1u}, {3u, 5u}, {64u, 64u}, {257u, 3u}}) {
        ImageRef image = pattern(w, h);
        auto png = encode(image);
        ASSERT_TRUE(png);
        const Bytes signature{0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n'};
        ASSERT_GT(png->size(), signature.size());
        EXPECT_EQ(Bytes(png->begin(), png->begin() + 8), signature);
        ImageRef back = CreateIconFromCachedBitmap(*png);
        ASSERT_TRUE(back);
        EXPECT_EQ(back->width(), w);
        EXPECT_EQ(back->height(), h);
        EXPECT_EQ(back->pixels(), image->pixels()) << w << "x" << h;
    }
}

TEST(ImageEncoderTest, RefusesWhatItCannotWriteAndKeepsTheBuffer) {
    auto buffer = std::make_shared<Bytes>(Bytes{1, 2, 3});
    EXPECT_FALSE(ImageEncoder::create(nullptr, ImageEncoder::kPNGType, 1));
    EXPECT_FALSE(ImageEncoder::create(buffer, "public.jpeg", 1));
    EXPECT_FALSE(ImageEncoder::create(buffer, ImageEncoder::kPNGType, 2));
    EXPECT_FALSE(ImageEncoder::create(buffer, ImageEncoder::kPNGType, 0));

    auto none = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    EXPECT_FALSE(none->finalize()) << "no image added";
    auto twice = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    twice->addImage(pattern(2, 2));
    twice->addImage(pattern(2, 2));
    EXPECT_FALSE(twice->finalize()) << "more images than announced";
    auto null = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    null->addImage(nullptr);
    EXPECT_FALSE(null->finalize());
    EXPECT_EQ(*buffer, (Bytes{1, 2, 3}));

    // A good image is appended after what the buffer held, once.
    auto once = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    once->addImage(pattern(2, 2));
    ASSERT_TRUE(once->finalize());
    EXPECT_FALSE(once->finalize());
    ASSERT_GT(buffer->size(), 3u);
    EXPECT_EQ(Bytes(buffer->begin(), buffer->begin() + 3), (Bytes{1, 2, 3}));
    ImageRef back = CreateIconFromCachedBitmap(Bytes(buffer->begin() + 3, buffer->end()));
    ASSERT_TRUE(back);
    EXPECT_EQ(back->pixels(), pattern(2, 2)->pixels());
}

TEST(ImageTest, RefusesPixelCountsThatDoNotMatchTheSize) {
    EXPECT_TRUE(Image::make(2, 3, Bytes(24)));
    EXPECT_FALSE(Image::make(2, 3, Bytes(23)));
    EXPECT_FALSE(Image::make(0, 3, Bytes()));
    EXPECT_FALSE(Image::make(3, 0, Bytes()));
    EXPECT_FALSE(Image::make(0x80000000u, 2, Bytes(0)));  // width * height * 4 overflows 32 bits
}

}  // namespace
}  // namespace tamber
