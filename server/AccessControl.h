#pragma once

#include <atomic>
#include <cstddef>
#include <string>

#include <httplib.h>

namespace tamber {

// The one check every request passes before any route sees it:
// - its Host must be the server's own loopback name and port (a page on another site that
//   rebinds its DNS name to 127.0.0.1 still sends its own name);
// - a POST, PUT, PATCH or DELETE that carries an Origin must come from the server's own origin;
// - an /api/ request needs the run's token, as "Authorization: Bearer TOKEN" or the session
//   cookie that POST /api/v1/session sets for a bearer; a token in an /api/ URL's query is
//   refused even when right (URLs end up in logs and histories);
// - its headers stay within kMaxHeaderBytes, and a JSON body within kMaxJsonBytes.
class AccessControl {
public:
    static constexpr size_t kMaxHeaderBytes = 64 * 1024;
    static constexpr size_t kMaxJsonBytes = 1024 * 1024;
    static constexpr const char* kCookieName = "tamber_session";

    explicit AccessControl(std::string token);

    // The port the server listens on; until it is set, no Host is accepted.
    void setPort(int port) { port_.store(port); }
    int port() const { return port_.load(); }
    const std::string& token() const { return token_; }

    // Handled (with the refusal in `response`) when the request is refused.
    httplib::Server::HandlerResponse check(const httplib::Request& request,
                                           httplib::Response& response) const;

    // Adds POST /api/v1/session, which sets the session cookie.
    void addRoutes(httplib::Server& server) const;

    bool hostAllowed(const std::string& host) const;
    bool originAllowed(const std::string& origin) const;

private:
    bool bearerMatches(const httplib::Request& request) const;
    bool cookieMatches(const httplib::Request& request) const;

    const std::string token_;
    std::atomic<int> port_{-1};
};

}  // namespace tamber
