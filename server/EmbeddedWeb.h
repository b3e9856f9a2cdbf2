#pragma once

#include <cstddef>
#include <span>

namespace tamber {

struct EmbeddedWebFile {
    const char* path;  // relative to web/, "/"-separated: "index.html", "js/app.js"
    const unsigned char* data;
    size_t size;
    const char* hash;  // 16 hex digits of the SHA-256 of the bytes
};

// The files of web/, turned into bytes at build time (cmake/EmbedWeb.cmake writes the
// definitions), so that the binary serves its page without any file beside it.
class EmbeddedWeb {
public:
    // Sorted by path.
    static std::span<const EmbeddedWebFile> files();
    // 16 hex digits that change whenever any file does: the version in the asset URLs.
    static const char* treeHash();
};

}  // namespace tamber
