#pragma once

#include <string>
#include <string_view>

namespace tamber {

// How the content of an item is labelled over HTTP.
class ContentTypes {
public:
    // The media type for an item's type identifier: "image/png" for "public.png", "text/plain;
    // charset=utf-8" for any plain text, ...; "application/octet-stream" when unknown.
    static std::string mediaTypeFor(std::string_view typeIdentifier);
    // `attachment; filename*=UTF-8''...` with every byte of the name outside the header's
    // token characters percent-encoded (so a quote, a semicolon or a line break in a name can
    // never end the header or add one).
    static std::string attachmentDisposition(std::string_view filename);
};

}  // namespace tamber
