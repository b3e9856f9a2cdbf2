#pragma once

#include <functional>
#include <memory>

#include <httplib.h>

#include "host/HostPorterExtension.h"
#include "platform/Url.h"

namespace tamber {

class DesktopThumbnails;
class EventHub;
class HostReplica;
class TremorService;

// What the HTTP routes work with. Access control (token, Host, Origin, limits) has run before
// any route sees a request, so routes need not check it.
struct ApiContext {
    std::shared_ptr<HostPorterExtension> provider;
    HostReplica* replica = nullptr;          // null until the server has one (some tests)
    Url storage;                             // the document storage folder
    std::shared_ptr<TremorService> journal;  // the event journal the server owns
    std::shared_ptr<EventHub> events;        // the server-sent events; null in some tests
    // Thumbnails of image files, shared with the desktop; null: images get none (some tests).
    std::shared_ptr<DesktopThumbnails> thumbnails;
    // Takes a multipart upload to `POST containers/{id}/children` (the content routes set it
    // when they are added); empty: such an upload is refused.
    std::function<void(const httplib::Request&, httplib::Response&, const httplib::ContentReader&)>
        multipartUpload;
};

// Route groups live in classes of their own, each with
//   static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
// which the server calls once before it starts listening.

}  // namespace tamber
