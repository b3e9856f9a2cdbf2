#pragma once

#include <memory>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// The event journal the server owns, read as `tamber events` reads it:
//   GET /api/v1/journal/events?since=ID&docid=1&follow=0&path=P&path=Q
// streams one HostJson::journalEvent record a line (NDJSON, chunked), replaying the history
// after `since` (default 0) for the trees given (default the document storage; each must lie
// in the published trees), then following live events until the client goes, or, with
// follow=0, ending after the history-done event. docid=1 reads the document-ID events instead.
// A blank line every 15 s while nothing happens lets a client tell a quiet journal from a lost
// server. A `since` past the journal's last event is refused with -1002 (409).
class JournalRoutes {
public:
    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
    // Ends every stream the routes of `context` are serving (a followed journal never ends by
    // itself), so that a server stopping can finish its requests in flight. Call it before
    // httplib::Server::stop().
    static void stopStreams(const ApiContext& context);
};

}  // namespace tamber
