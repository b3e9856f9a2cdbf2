#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>

#include "server/AccessControl.h"
#include "server/ApiContext.h"
#include "server/ConnectionPool.h"
#include "support/Status.h"

namespace tamber {

// The HTTP server: listens on the loopback addresses only (127.0.0.1, and ::1 on the same port
// when the machine has it; there is no way to listen elsewhere), runs every request through
// AccessControl, then the routes of the groups it was given. Its listening loops run on threads
// of their own.
//
// Limits: at most kMaxConnections connections served at once (more wait for a thread), idle
// connections closed as LoopbackListener says, JSON bodies and headers as AccessControl says.
//
// stop(): no more connections are accepted, the event streams end, the requests in flight
// finish, then the threads are joined. Harmless to call twice; the destructor calls it.
class HttpServer {
public:
    static constexpr size_t kMaxConnections = 64;

    using RouteGroup = std::function<void(httplib::Server&, std::shared_ptr<ApiContext>)>;

    HttpServer(std::shared_ptr<ApiContext> context, std::string token,
               std::vector<RouteGroup> groups);
    ~HttpServer();
    HttpServer(const HttpServer&) = delete;
    HttpServer& operator=(const HttpServer&) = delete;

    // Binds `port` (0: a free one) on 127.0.0.1, then the same port on ::1, and starts
    // listening. Fails when 127.0.0.1 cannot be bound (the port is taken).
    Status start(int port);
    int port() const { return access_->port(); }
    const std::string& token() const { return access_->token(); }
    // Whether ::1 is served too.
    bool servesIPv6() const { return listeners_.size() > 1; }

    void stop();

private:
    std::unique_ptr<httplib::Server> makeListener();

    std::shared_ptr<ApiContext> context_;
    std::shared_ptr<AccessControl> access_;
    std::vector<RouteGroup> groups_;
    std::unique_ptr<ConnectionPool> pool_;
    std::vector<std::unique_ptr<httplib::Server>> listeners_;
    std::vector<std::thread> threads_;
    bool stopped_ = false;
    // Tells the connections to leave once their request in flight is answered.
    std::shared_ptr<std::atomic<bool>> stopping_ = std::make_shared<std::atomic<bool>>(false);
};

}  // namespace tamber
