#include "platform/imaging/PixbufThumbnailRenderer.h"

#include <gdk-pixbuf/gdk-pixbuf.h>

#include <algorithm>
#include <cerrno>
#include <memory>

namespace tamber {

namespace {

struct ObjectUnref {
    void operator()(void* object) const {
        if (object)
            g_object_unref(object);
    }
};
template <class T>
using GObjectPtr = std::unique_ptr<T, ObjectUnref>;

// What the size-prepared handler learns and decides, before any pixel is allocated.
struct Sizing {
    int edge = 0;
    bool tooLarge = false;
    int64_t width = 0;
    int64_t height = 0;
};

void onSizePrepared(GdkPixbufLoader* loader, int width, int height, gpointer data) {
    auto& sizing = *static_cast<Sizing*>(data);
    sizing.width = width;
    sizing.height = height;
    if (int64_t(width) * height > PixbufThumbnailRenderer::kMaxPixels) {
        // Zero asks the loader to allocate nothing more; the rest of the file is not fed.
        sizing.tooLarge = true;
        gdk_pixbuf_loader_set_size(loader, 0, 0);
        return;
    }
    // Loaders that can (JPEG) decode straight at the smaller size; the others are scaled after.
    if (width > sizing.edge || height > sizing.edge) {
        const double scale = std::min(double(sizing.edge) / width, double(sizing.edge) / height);
        gdk_pixbuf_loader_set_size(loader, std::max(1, int(width * scale + 0.5)),
                                   std::max(1, int(height * scale + 0.5)));
    }
}

Error undecodable(GError* error) {
    std::string reason = "the file is not an image that can be read";
    if (error) {
        reason += std::string(": ") + error->message;
        g_error_free(error);
    }
    return Error(kPosixErrorDomain, EBADMSG, {{"description", reason}});
}

}  // namespace

Result<Bytes> PixbufThumbnailRenderer::render(const Bytes& source, int edge,
                                              const TextChunks& text) {
    if (edge < 1)
        return Error::posix(EINVAL);
    GObjectPtr<GdkPixbufLoader> loader(gdk_pixbuf_loader_new());
    Sizing sizing;
    sizing.edge = edge;
    g_signal_connect(loader.get(), "size-prepared", G_CALLBACK(onSizePrepared), &sizing);
    GError* error = nullptr;
    // Fed in pieces, so that an image found too large stops being read at its header.
    constexpr size_t kPiece = 64 * 1024;
    bool written = true;
    for (size_t at = 0; written && !sizing.tooLarge && at < source.size(); at += kPiece)
        written = gdk_pixbuf_loader_write(loader.get(), source.data() + at,
                                          std::min(kPiece, source.size() - at), &error);
    // A loader is always closed, also after a failed write, or it complains when finalized.
    GError* closeError = nullptr;
    const bool closed = gdk_pixbuf_loader_close(loader.get(), &closeError);
    if (sizing.tooLarge) {
        g_clear_error(&error);
        g_clear_error(&closeError);
        return Error(kPosixErrorDomain, EFBIG,
                     {{"description", "the image is too large to make a thumbnail of (" +
                                          std::to_string(sizing.width) + " x " +
                                          std::to_string(sizing.height) + " pixels)"}});
    }
    if (!written) {
        g_clear_error(&closeError);
        return undecodable(error);
    }
    if (!closed || source.empty())
        return undecodable(closeError);
    GdkPixbuf* decoded = gdk_pixbuf_loader_get_pixbuf(loader.get());  // the loader's
    if (!decoded)
        return undecodable(nullptr);
    GObjectPtr<GdkPixbuf> upright(gdk_pixbuf_apply_embedded_orientation(decoded));
    if (!upright)
        return undecodable(nullptr);

    const int width = gdk_pixbuf_get_width(upright.get());
    const int height = gdk_pixbuf_get_height(upright.get());
    if (width < 1 || height < 1)
        return undecodable(nullptr);
    GObjectPtr<GdkPixbuf> scaled;
    if (width > edge || height > edge) {
        const double scale = std::min(double(edge) / width, double(edge) / height);
        const int w = std::clamp(int(width * scale + 0.5), 1, edge);
        const int h = std::clamp(int(height * scale + 0.5), 1, edge);
        scaled.reset(gdk_pixbuf_scale_simple(upright.get(), w, h, GDK_INTERP_BILINEAR));
        if (!scaled)
            return Error::posix(ENOMEM);
    } else {
        scaled = std::move(upright);
    }

    std::vector<std::string> keys;
    for (const auto& [key, value] : text) keys.push_back("tEXt::" + key);
    std::vector<char*> keyList;
    std::vector<char*> valueList;
    for (size_t i = 0; i < text.size(); ++i) {
        keyList.push_back(keys[i].data());
        valueList.push_back(const_cast<char*>(text[i].second.c_str()));
    }
    keyList.push_back(nullptr);
    valueList.push_back(nullptr);
    gchar* buffer = nullptr;
    gsize length = 0;
    if (!gdk_pixbuf_save_to_bufferv(scaled.get(), &buffer, &length, "png", keyList.data(),
                                    valueList.data(), &error)) {
        std::string reason = "the thumbnail could not be encoded";
        if (error) {
            reason += std::string(": ") + error->message;
            g_error_free(error);
        }
        return Error(kPosixErrorDomain, EIO, {{"description", reason}});
    }
    Bytes png(reinterpret_cast<uint8_t*>(buffer), reinterpret_cast<uint8_t*>(buffer) + length);
    g_free(buffer);
    return png;
}

}  // namespace tamber
