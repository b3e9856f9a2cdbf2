#pragma once

#include <chrono>
#include <memory>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// GET /api/v1/events: Server-Sent Events from ApiContext::events. Each batch the replica
// applied is "id: SEQ / event: changes / data: {updated, deleted, changes}"; a container the
// provider signalled is "event: signal / data: {container}". A client that reconnects with
// Last-Event-ID first gets every batch after it, or "event: reset" when they are no longer
// kept. A comment line keeps an idle connection open.
class EventRoutes {
public:
    static constexpr std::chrono::seconds kKeepAlive{15};

    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
};

}  // namespace tamber
