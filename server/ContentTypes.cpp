#include "server/ContentTypes.h"

#include <utility>

#include "platform/TypeIdentifiers.h"

namespace tamber {

namespace {

// Most specific first: a type is labelled by the first entry it conforms to.
constexpr std::pair<std::string_view, std::string_view> kMediaTypes[] = {
    {"public.png", "image/png"},
    {"public.jpeg", "image/jpeg"},
    {"public.gif", "image/gif"},
    {"public.tiff", "image/tiff"},
    {"public.heic", "image/heic"},
    {"public.svg-image", "image/svg+xml"},
    {"org.webmproject.webp", "image/webp"},
    {"com.microsoft.bmp", "image/bmp"},
    {"public.pdf", "application/pdf"},
    {"public.json", "application/json"},
    {"public.xml", "application/xml"},
    {"public.html", "text/html; charset=utf-8"},
    {"public.plain-text", "text/plain; charset=utf-8"},
    {"public.zip-archive", "application/zip"},
    {"org.gnu.gnu-zip-archive", "application/gzip"},
    {"public.tar-archive", "application/x-tar"},
    {"public.mp3", "audio/mpeg"},
    {"public.mpeg-4-audio", "audio/mp4"},
    {"public.mpeg-4", "video/mp4"},
};

bool isAttributeChar(unsigned char c) {
    if ((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9'))
        return true;
    switch (c) {
        case '!':
        case '#':
        case '$':
        case '&':
        case '+':
        case '-':
        case '.':
        case '^':
        case '_':
        case '`':
        case '|':
        case '~':
            return true;
        default:
            return false;
    }
}

}  // namespace

std::string ContentTypes::mediaTypeFor(std::string_view typeIdentifier) {
    for (const auto& [type, media] : kMediaTypes) {
        if (TypeConforms(typeIdentifier, type))
            return std::string(media);
    }
    return "application/octet-stream";
}

std::string ContentTypes::attachmentDisposition(std::string_view filename) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string header = "attachment; filename*=UTF-8''";
    for (unsigned char c : filename) {
        if (isAttributeChar(c)) {
            header += static_cast<char>(c);
        } else {
            header += '%';
            header += kHex[c >> 4];
            header += kHex[c & 0xF];
        }
    }
    return header;
}

}  // namespace tamber
