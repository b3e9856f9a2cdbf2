#pragma once

#include <functional>
#include <memory>
#include <string>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// The routes that move file content, never holding a file whole in memory:
//   GET  /api/v1/items/{id}/content      the bytes, streamed; one `Range` served as 206
//   PUT  /api/v1/items/{id}/content      a safe save over a file: same identifier, same tags
//   POST /api/v1/containers/{id}/children  with multipart/form-data: each file part imported
//   GET  /api/v1/items/{id}/thumbnail?size=N  a PNG: an image file's from the desktop's
//        thumbnail cache (made when missing), anything else's from the provider; or 404
// Identifiers are resolved through the provider; files are opened beneath their published root
// without following a symbolic link, so a link never serves or replaces anything outside.
class ContentRoutes {
public:
    // Registers the GET and PUT routes above (not the POST: see addChildrenPost).
    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);

    // What POST containers/{id}/children does with a request that is not an upload (the JSON
    // "create a folder" request), given its body, which is read here up to `jsonLimit` bytes
    // (413 past it).
    using OtherPost =
        std::function<void(const httplib::Request&, httplib::Response&, const std::string& body)>;
    // The library stops at the first handler whose path matches, and one that streams its body
    // is tried before any other: so POST containers/{id}/children has this one handler, which
    // streams an upload and hands any other request to `otherwise`.
    static void addChildrenPost(httplib::Server& server, std::shared_ptr<ApiContext> context,
                                OtherPost otherwise, size_t jsonLimit = 1 << 20);

    // The upload of POST containers/{id}/children (the identifier is the path's first match):
    // every file part is streamed to a hidden staging file in the folder and, once the whole
    // body has arrived, given its name, bouncing ("name 2.ext") when taken; answers
    // {"items": [...]}. A cut-short body leaves nothing behind. Returns false, answering
    // nothing and reading nothing, when the request is not multipart/form-data.
    static bool handleUpload(const httplib::Request& request, httplib::Response& response,
                             const httplib::ContentReader& reader, ApiContext& context);

    static void handleDownload(const httplib::Request& request, httplib::Response& response,
                               ApiContext& context);
    static void handleSave(const httplib::Request& request, httplib::Response& response,
                           const httplib::ContentReader& reader, ApiContext& context);
    static void handleThumbnail(const httplib::Request& request, httplib::Response& response,
                                ApiContext& context);
};

}  // namespace tamber
