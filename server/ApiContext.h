#pragma once

#include <memory>

#include "host/HostPorterExtension.h"
#include "platform/Url.h"

namespace tamber {

class HostReplica;

// What the HTTP routes work with. Access control (token, Host, Origin, limits) has run before
// any route sees a request, so routes need not check it.
struct ApiContext {
    std::shared_ptr<HostPorterExtension> provider;
    HostReplica* replica = nullptr;  // null until the server has one (some tests)
    Url storage;                     // the document storage folder
};

}  // namespace tamber
