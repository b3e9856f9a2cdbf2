#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include <dirent.h>
#include <httplib.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include "server/HttpServer.h"

namespace tamber {
namespace {

constexpr const char* kToken = "0123456789abcdef";

// A server with one route that holds its request until the test lets it go.
struct HeldRoute {
    std::promise<void> entered;
    std::shared_future<void> release;
    HttpServer::RouteGroup group() {
        return [this](httplib::Server& server, std::shared_ptr<ApiContext>) {
            server.Get("/api/v1/slow",
                       [this](const httplib::Request&, httplib::Response& response) {
                           entered.set_value();
                           release.wait();
                           response.set_content("{\"done\":true}", "application/json");
                       });
        };
    }
};

std::unique_ptr<httplib::Client> clientFor(int port) {
    auto client = std::make_unique<httplib::Client>("127.0.0.1", port);
    client->set_bearer_token_auth(kToken);
    client->set_keep_alive(true);
    return client;
}

// Whether `server.stop()` returned within 30 s (a hang turned into a failure; the server is
// then left behind on purpose).
bool stopsInTime(std::shared_ptr<HttpServer> server) {
    auto done = std::make_shared<std::promise<void>>();
    auto stopped = done->get_future();
    std::thread([server, done] {
        server->stop();
        done->set_value();
    }).detach();
    return stopped.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
}

TEST(HttpServerTest, APortThatIsTakenIsAnErrorNotASecondServer) {
    auto first = std::make_shared<HttpServer>(std::make_shared<ApiContext>(), kToken,
                                              std::vector<HttpServer::RouteGroup>{});
    ASSERT_TRUE(first->start(0).ok());
    HttpServer second(std::make_shared<ApiContext>(), kToken, {});
    auto refused = second.start(first->port());
    ASSERT_FALSE(refused.ok());
    EXPECT_NE(refused.error().description().find(std::to_string(first->port())), std::string::npos);
}

TEST(HttpServerTest, StopRightAfterStartReturns) {
    // The listening threads may not have begun to accept yet when the stop comes.
    for (int i = 0; i < 20; ++i) {
        auto server = std::make_shared<HttpServer>(std::make_shared<ApiContext>(), kToken,
                                                   std::vector<HttpServer::RouteGroup>{});
        ASSERT_TRUE(server->start(0).ok());
        ASSERT_TRUE(stopsInTime(server)) << "round " << i;
    }
}

TEST(HttpServerTest, StopFinishesTheRequestInFlightAndDoesNotWaitForIdleConnections) {
    HeldRoute held;
    std::promise<void> release;
    held.release = release.get_future().share();
    HttpServer server(std::make_shared<ApiContext>(), kToken, {held.group()});
    ASSERT_TRUE(server.start(0).ok());
    int port = server.port();

    // An idle keep-alive connection: it must not hold the stop for the idle timeout.
    auto idle = clientFor(port);
    EXPECT_EQ(idle->Get("/api/v1/nothing")->status, 404);

    auto inFlight = std::async(std::launch::async, [port] {
        auto result = clientFor(port)->Get("/api/v1/slow");
        return result ? result->status : -1;
    });
    held.entered.get_future().wait();
    auto stopped = std::async(std::launch::async, [&server] { server.stop(); });
    // The stop waits for the request...
    EXPECT_EQ(stopped.wait_for(std::chrono::milliseconds(300)), std::future_status::timeout);
    release.set_value();
    // ...which completes with its answer, and then the stop returns.
    EXPECT_EQ(inFlight.get(), 200);
    ASSERT_EQ(stopped.wait_for(std::chrono::seconds(30)), std::future_status::ready);
    // Nothing listens any more.
    auto after = clientFor(port);
    after->set_connection_timeout(2, 0);
    EXPECT_FALSE(after->Get("/api/v1/nothing"));
}

// Whether the connection from `remotePort` to `localPort` (this process's own socket) has
// Nagle's algorithm off; -1 when no such socket is found.
int noDelayOfConnection(int localPort, int remotePort) {
    DIR* fds = ::opendir("/proc/self/fd");
    if (!fds)
        return -1;
    int found = -1;
    while (dirent* entry = ::readdir(fds)) {
        int fd = std::atoi(entry->d_name);
        sockaddr_in local{};
        sockaddr_in peer{};
        socklen_t localSize = sizeof local;
        socklen_t peerSize = sizeof peer;
        if (fd <= 2 || ::getsockname(fd, reinterpret_cast<sockaddr*>(&local), &localSize) != 0 ||
            ::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &peerSize) != 0 ||
            local.sin_family != AF_INET || ntohs(local.sin_port) != localPort ||
            ntohs(peer.sin_port) != remotePort)
            continue;
        int value = 0;
        socklen_t size = sizeof value;
        if (::getsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &value, &size) == 0)
            found = value != 0 ? 1 : 0;
    }
    ::closedir(fds);
    return found;
}

// A response is written head first, then body: with Nagle's algorithm on, the body would wait
// for the client's delayed acknowledgement (40 ms on Linux) on every request.
TEST(HttpServerTest, ConnectionsSendWithoutWaitingForAcknowledgements) {
    auto group = [](httplib::Server& server, std::shared_ptr<ApiContext>) {
        server.Get(
            "/api/v1/socket", [](const httplib::Request& request, httplib::Response& response) {
                response.set_content(
                    std::to_string(noDelayOfConnection(request.local_port, request.remote_port)),
                    "text/plain");
            });
    };
    HttpServer server(std::make_shared<ApiContext>(), kToken, {group});
    ASSERT_TRUE(server.start(0).ok());
    auto result = clientFor(server.port())->Get("/api/v1/socket");
    ASSERT_TRUE(result);
    EXPECT_EQ(result->status, 200);
    EXPECT_EQ(result->body, "1") << "-1: the server's socket was not found";
    server.stop();
}

// On loopback an answer is sent as it is, whatever the client accepts: the library's brotli
// took 180 ms for a page of 200 records.
TEST(HttpServerTest, AnswersAreNotCompressed) {
    const std::string body = "{\"items\":[" + std::string(20000, ' ') + "]}";
    auto group = [body](httplib::Server& server, std::shared_ptr<ApiContext>) {
        server.Get("/api/v1/big", [body](const httplib::Request&, httplib::Response& response) {
            response.set_content(body, "application/json");
        });
        server.Get("/page.html", [](const httplib::Request&, httplib::Response& response) {
            response.set_content(std::string(5000, 'x'), "text/html");
        });
    };
    HttpServer server(std::make_shared<ApiContext>(), kToken, {group});
    ASSERT_TRUE(server.start(0).ok());
    auto client = clientFor(server.port());
    for (const char* path : {"/api/v1/big", "/page.html"}) {
        auto result = client->Get(path, {{"Accept-Encoding", "br, gzip, deflate"}});
        ASSERT_TRUE(result) << path;
        EXPECT_EQ(result->status, 200) << path;
        EXPECT_FALSE(result->has_header("Content-Encoding"))
            << path << ": " << result->get_header_value("Content-Encoding");
    }
    auto json = client->Get("/api/v1/big", {{"Accept-Encoding", "br"}});
    ASSERT_TRUE(json);
    EXPECT_EQ(json->body, body);
    server.stop();
}

}  // namespace
}  // namespace tamber

namespace tamber {
namespace {

TEST(HttpServerTest, AnswersOnBothLoopbackAddressesOnTheSamePort) {
    HttpServer server(std::make_shared<ApiContext>(), kToken, {});
    ASSERT_TRUE(server.start(0).ok());
    std::string port = std::to_string(server.port());
    httplib::Client ipv4("127.0.0.1", server.port());
    auto answered =
        ipv4.Get("/api/v1/nothing", {{"Authorization", std::string("Bearer ") + kToken}});
    ASSERT_TRUE(answered);
    EXPECT_EQ(answered->status, 404);
    if (!server.servesIPv6())
        GTEST_SKIP() << "no IPv6 loopback on this machine";
    httplib::Client ipv6("::1", server.port());
    auto viaIpv6 =
        ipv6.Get("/api/v1/nothing",
                 {{"Host", "[::1]:" + port}, {"Authorization", std::string("Bearer ") + kToken}});
    ASSERT_TRUE(viaIpv6);
    EXPECT_EQ(viaIpv6->status, 404);
    EXPECT_NE(viaIpv6->body.find("no such route"), std::string::npos);
}

}  // namespace
}  // namespace tamber

namespace tamber {
namespace {

// Connections beyond the bound wait for a thread instead of getting one each: with every
// thread held, one more request is not served until a held one is let go, and all of them are
// answered in the end.
TEST(HttpServerTest, ConnectionsBeyondTheBoundWaitAndAreServedLater) {
    constexpr size_t kBound = HttpServer::kMaxConnections;
    std::mutex mutex;
    std::condition_variable changed;
    size_t inside = 0, most = 0, served = 0;
    bool released = false;
    HttpServer::RouteGroup group = [&](httplib::Server& server, std::shared_ptr<ApiContext>) {
        server.Get("/api/v1/slow", [&](const httplib::Request&, httplib::Response& response) {
            std::unique_lock lock(mutex);
            most = std::max(most, ++inside);
            changed.notify_all();
            changed.wait(lock, [&] { return released; });
            --inside;
            ++served;
            response.set_content("{}", "application/json");
        });
    };
    auto releaseAll = [&] {
        {
            std::lock_guard lock(mutex);
            released = true;
        }
        changed.notify_all();
    };
    HttpServer server(std::make_shared<ApiContext>(), kToken, {group});
    ASSERT_TRUE(server.start(0).ok());
    const int port = server.port();

    std::vector<std::future<int>> answers;
    // Whatever fails below, the held requests are let go before the answers are waited for
    // and the server stops.
    struct Release {
        std::function<void()> run;
        ~Release() { run(); }
    } releaseAtEnd{releaseAll};
    for (size_t i = 0; i < kBound + 1; ++i) {
        answers.push_back(std::async(std::launch::async, [port] {
            auto client = clientFor(port);
            client->set_read_timeout(60, 0);
            auto result = client->Get("/api/v1/slow");
            return result ? result->status : -1;
        }));
    }
    {
        std::unique_lock lock(mutex);
        ASSERT_TRUE(
            changed.wait_for(lock, std::chrono::seconds(60), [&] { return inside >= kBound; }));
    }
    // Time for the extra connection to be served, if the bound let it.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    {
        std::lock_guard lock(mutex);
        EXPECT_EQ(most, kBound);
    }
    releaseAll();
    for (auto& answer : answers) EXPECT_EQ(answer.get(), 200);
    std::lock_guard lock(mutex);
    EXPECT_EQ(served, kBound + 1);
    EXPECT_EQ(most, kBound);
}

}  // namespace
}  // namespace tamber
