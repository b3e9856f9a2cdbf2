#pragma once

#include <gdk-pixbuf/gdk-pixbuf.h>

#include <cstdint>
#include <string>
#include <utility>

#include "platform/objects/Data.h"

namespace tamber::testing {

// An image file of `width` x `height` pixels in `format` ("png", "jpeg", "bmp"...), encoded by
// gdk-pixbuf, with a gradient so that it is not trivially compressible.
inline std::string encodedImage(int width, int height, const char* format) {
    GdkPixbuf* pixbuf = gdk_pixbuf_new(GDK_COLORSPACE_RGB, FALSE, 8, width, height);
    const int stride = gdk_pixbuf_get_rowstride(pixbuf);
    guchar* pixels = gdk_pixbuf_get_pixels(pixbuf);
    for (int y = 0; y < height; ++y)
        for (int x = 0; x < width; ++x) {
            guchar* p = pixels + y * stride + x * 3;
            p[0] = guchar(x * 255 / width);
            p[1] = guchar(y * 255 / height);
            p[2] = guchar((x + y) & 0xff);
        }
    gchar* buffer = nullptr;
    gsize length = 0;
    const bool saved =
        gdk_pixbuf_save_to_buffer(pixbuf, &buffer, &length, format, nullptr, nullptr);
    g_object_unref(pixbuf);
    if (!saved)
        return {};
    std::string bytes(buffer, length);
    g_free(buffer);
    return bytes;
}

// The pixel size of an encoded image, decoded by gdk-pixbuf; {0, 0} when it does not decode.
inline std::pair<int, int> decodedSize(const std::string& bytes) {
    GdkPixbufLoader* loader = gdk_pixbuf_loader_new();
    bool ok = gdk_pixbuf_loader_write(loader, reinterpret_cast<const guchar*>(bytes.data()),
                                      bytes.size(), nullptr);
    ok = gdk_pixbuf_loader_close(loader, nullptr) && ok;
    std::pair<int, int> size{0, 0};
    if (GdkPixbuf* pixbuf = ok ? gdk_pixbuf_loader_get_pixbuf(loader) : nullptr)
        size = {gdk_pixbuf_get_width(pixbuf), gdk_pixbuf_get_height(pixbuf)};
    g_object_unref(loader);
    return size;
}

// The start of a PNG file that claims `width` x `height` RGB pixels: a valid header, then a
// pixel stream cut short. Tiny on disk, enormous once decoded.
inline std::string pngHeaderClaiming(uint32_t width, uint32_t height) {
    auto crc = [](const std::string& bytes) {
        uint32_t c = 0xffffffffu;
        for (unsigned char byte : bytes) {
            c ^= byte;
            for (int bit = 0; bit < 8; ++bit) c = (c >> 1) ^ (0xedb88320u & (0u - (c & 1)));
        }
        return ~c;
    };
    auto be32 = [](uint32_t v) {
        return std::string{char(v >> 24), char(v >> 16), char(v >> 8), char(v)};
    };
    auto chunk = [&](const std::string& type, const std::string& data) {
        return be32(uint32_t(data.size())) + type + data + be32(crc(type + data));
    };
    std::string ihdr = be32(width) + be32(height) + std::string("\x08\x02\x00\x00\x00", 5);
    return std::string("\x89PNG\r\n\x1a\n", 8) + chunk("IHDR", ihdr) +
           chunk("IDAT", std::string("\x78\x01", 2));
}

inline std::pair<int, int> decodedSize(const Bytes& bytes) {
    return decodedSize(std::string(bytes.begin(), bytes.end()));
}

}  // namespace tamber::testing
