#include "server/HttpServer.h"

#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <exception>

#include "runtime/HostJson.h"
#include "server/ApiReply.h"
#include "server/EventHub.h"
#include "server/LoopbackListener.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr const char* kServerDomain = "TamberServerErrorDomain";

const char* reasonFor(int status) {
    switch (status) {
        case 400:
            return "bad request";
        case 404:
            return "no such route";
        case 405:
            return "method not allowed";
        case 413:
            return "request body too large";
        case 416:
            return "range not satisfiable";
        default:
            return status < 500 ? "request refused" : "internal error";
    }
}

}  // namespace

HttpServer::HttpServer(std::shared_ptr<ApiContext> context, std::string token,
                       std::vector<RouteGroup> groups)
    : context_(std::move(context)),
      access_(std::make_shared<AccessControl>(std::move(token))),
      groups_(std::move(groups)) {}

HttpServer::~HttpServer() {
    stop();
}

std::unique_ptr<httplib::Server> HttpServer::makeListener() {
    auto server = std::make_unique<LoopbackListener>(stopping_);
    ConnectionPool* pool = pool_.get();
    server->new_task_queue = [pool] { return pool->queueForListener().release(); };
    // The library's default also sets SO_REUSEPORT, which would let a second server (ours or
    // anyone's of the same user) share the port and take some of the connections.
    server->set_socket_options([](socket_t sock) {
        int yes = 1;
        ::setsockopt(sock, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
    });
    auto access = access_;
    server->set_pre_routing_handler(
        [access](const httplib::Request& request, httplib::Response& response) {
            // Answers go out uncompressed: on loopback compression only costs time, and the
            // library compresses with brotli at its slowest setting (180 ms for a page of 200
            // records). It decides by the request's Accept-Encoding when it writes the answer;
            // the request is its own non-const object, handed to this hook as const.
            const_cast<httplib::Request&>(request).headers.erase("Accept-Encoding");
            return access->check(request, response);
        });
    // Every refusal, also the library's own (no such route, bad request line), is the error
    // object; a route that already answered one keeps it.
    server->set_error_handler(httplib::Server::HandlerWithResponse([](const httplib::Request&,
                                                                      httplib::Response& response) {
        if (!response.body.empty())
            return httplib::Server::HandlerResponse::Unhandled;
        Error error(kServerDomain, response.status, {{"description", reasonFor(response.status)}});
        ApiReply::json(response, HostJson::error(error), response.status);
        return httplib::Server::HandlerResponse::Handled;
    }));
    // What went wrong inside goes to the log, never to the client.
    server->set_exception_handler(
        [](const httplib::Request& request, httplib::Response& response, std::exception_ptr ep) {
            std::string what = "unknown exception";
            try {
                if (ep)
                    std::rethrow_exception(ep);
            } catch (const std::exception& e) {
                what = e.what();
            } catch (...) {
            }
            logError("request " + request.method + " " + request.path + " failed: " + what);
            Error error(kServerDomain, 500, {{"description", "internal error"}});
            response.body.clear();
            ApiReply::json(response, HostJson::error(error), 500);
        });
    access_->addRoutes(*server);
    for (const auto& group : groups_) group(*server, context_);
    return server;
}

Status HttpServer::start(int port) {
    if (stopped_ || !listeners_.empty())
        return Error::posix(EALREADY);
    pool_ = std::make_unique<ConnectionPool>(kMaxConnections);
    auto ipv4 = makeListener();
    int bound = port;
    if (port == 0) {
        bound = ipv4->bind_to_any_port("127.0.0.1");
        if (bound <= 0)
            return Error(kPosixErrorDomain, EADDRINUSE,
                         {{"description", "can't listen on 127.0.0.1: no free port"}});
    } else if (!ipv4->bind_to_port("127.0.0.1", port)) {
        return Error(kPosixErrorDomain, EADDRINUSE,
                     {{"description", "can't listen on 127.0.0.1:" + std::to_string(port) +
                                          " (is the port taken?)"}});
    }
    access_->setPort(bound);
    listeners_.push_back(std::move(ipv4));

    auto ipv6 = makeListener();
    ipv6->set_address_family(AF_INET6);
    if (ipv6->bind_to_port("::1", bound))
        listeners_.push_back(std::move(ipv6));
    else
        logInfo("not listening on [::1]:" + std::to_string(bound) + " (no IPv6 loopback)");

    for (auto& listener : listeners_) {
        httplib::Server* server = listener.get();
        auto exited = std::make_shared<std::atomic<bool>>(false);
        threads_.emplace_back([server, exited] {
            server->listen_after_bind();
            exited->store(true);
        });
        // A stop that comes before the loop runs would be lost (the library only stops a
        // running loop) and leave it accepting for ever: wait until it runs.
        while (!server->is_running() && !exited->load())
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return Status::OK();
}

void HttpServer::stop() {
    if (stopped_)
        return;
    stopped_ = true;
    stopping_->store(true);
    // Event streams would otherwise keep their connections, and so the stop, waiting.
    if (context_ && context_->events)
        context_->events->close();
    for (auto& listener : listeners_) listener->stop();
    for (auto& thread : threads_)
        if (thread.joinable())
            thread.join();
    threads_.clear();
    if (pool_)
        pool_->shutdown();
    listeners_.clear();
}

}  // namespace tamber
