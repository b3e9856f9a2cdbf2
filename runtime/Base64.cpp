#include "runtime/Base64.h"

#include <glib.h>

#include <cctype>

namespace tamber {

std::string base64Encode(const Bytes& bytes) {
    gchar* text = g_base64_encode(bytes.data(), bytes.size());
    std::string result(text);
    g_free(text);
    return result;
}

std::optional<Bytes> base64Decode(const std::string& text) {
    // GLib skips what it does not understand; a mistyped token must be an error instead.
    if (text.size() % 4 != 0)
        return std::nullopt;
    for (size_t i = 0; i < text.size(); ++i) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        bool padding = c == '=' && i + 2 >= text.size();
        if (!std::isalnum(c) && c != '+' && c != '/' && !padding)
            return std::nullopt;
    }
    gsize length = 0;
    guchar* data = g_base64_decode(text.c_str(), &length);
    Bytes bytes(data, data + length);
    g_free(data);
    return bytes;
}

}  // namespace tamber
