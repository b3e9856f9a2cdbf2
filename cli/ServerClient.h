#pragma once

#include <sys/types.h>

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "runtime/RunFile.h"
#include "support/Result.h"

namespace httplib {
class Client;
}

namespace tamber {

// Talks to a running `tamber serve` on loopback, with the token its run file holds. Every
// answer is JSON (or bytes, or a stream); an error object comes back as the Error it describes,
// so a verb fails through the server exactly as it fails directly. A server that does not
// answer (it stopped after it was found) is an error naming it, after a connect timeout: never
// a hang.
class ServerClient {
public:
    static constexpr int kConnectTimeoutSeconds = 3;
    // A lookup or a page is quick: a server silent that long is stuck, and the verb says so.
    static constexpr int kReadTimeoutSeconds = 30;
    // Generous: an import or a purge runs before the answer comes.
    static constexpr int kChangeTimeoutSeconds = 600;
    // A stream of events sends a comment every 15 s; four times that in silence is a lost
    // server.
    static constexpr int kStreamTimeoutSeconds = 60;

    explicit ServerClient(RunFileRecord server);
    ~ServerClient();
    ServerClient(const ServerClient&) = delete;
    ServerClient& operator=(const ServerClient&) = delete;

    const RunFileRecord& server() const { return server_; }

    // `path` is below /api/v1/ and already encoded (see encode()).
    Result<nlohmann::json> get(const std::string& path);
    Result<nlohmann::json> post(const std::string& path, const nlohmann::json& body);
    Result<nlohmann::json> patch(const std::string& path, const nlohmann::json& body);
    Result<nlohmann::json> remove(const std::string& path);
    // The body's bytes as they are (a thumbnail).
    Result<std::string> getBytes(const std::string& path);

    // Reads a stream (Server-Sent Events) and hands each piece to `receive` as it arrives,
    // until the server ends it, `receive` returns false or stop() is called. Stopped: OK.
    Status stream(const std::string& path, std::function<bool(std::string_view piece)> receive);
    // Ends a stream() running on another thread; safe to call from any thread.
    void stop();

    // Percent-encodes one path segment or query value: everything but letters, digits and
    // "-._~".
    static std::string encode(std::string_view text);

private:
    struct Reply {
        int status = 0;
        std::string body;
    };
    Result<Reply> send(const std::string& method, const std::string& path, const std::string* body);
    Result<nlohmann::json> json(const std::string& method, const std::string& path,
                                const nlohmann::json* body);
    std::unique_ptr<httplib::Client> makeClient(int readTimeoutSeconds) const;
    // Why a request got no answer, for a person.
    Error unreachable(const std::string& why) const;
    // The error an unsuccessful answer carries.
    Error failure(const Reply& reply) const;

    RunFileRecord server_;
    std::mutex mutex_;
    httplib::Client* streaming_ = nullptr;  // guarded by mutex_
    std::atomic<bool> stopped_{false};
};

}  // namespace tamber
