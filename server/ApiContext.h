#pragma once

#include <memory>

#include "host/HostPorterExtension.h"
#include "platform/Url.h"

namespace tamber {

class HostReplica;
class TremorService;

// What the HTTP routes work with. Access control (token, Host, Origin, limits) has run before
// any route sees a request, so routes need not check it.
struct ApiContext {
    std::shared_ptr<HostPorterExtension> provider;
    HostReplica* replica = nullptr;          // null until the server has one (some tests)
    Url storage;                             // the document storage folder
    std::shared_ptr<TremorService> journal;  // the event journal the server owns
};

// Route groups live in classes of their own, each with
//   static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
// which the server calls once before it starts listening.

}  // namespace tamber
