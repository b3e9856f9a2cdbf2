#pragma once

#include <memory>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// What the server knows of itself and its replica, under /api/v1/:
//   GET status   {"state": "ready"|"catching-up", "items", "journalLag", "lastEventTime",
//                 "historyLost", "sequence", "pid", "storage"}
//   GET search?q=&tag=&type=&favorite=&recent=&trashed=&limit=   {"items": [...]}
class StatusRoutes {
public:
    static constexpr size_t kMaxSearchLimit = 1000;

    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
};

}  // namespace tamber
