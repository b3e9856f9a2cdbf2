#include "server/AccessControl.h"

#include <nlohmann/json.hpp>

#include "runtime/HostJson.h"
#include "server/ApiReply.h"
#include "support/Error.h"
#include "support/RandomToken.h"

namespace tamber {

namespace {

constexpr const char* kAccessDomain = "TamberAccessErrorDomain";

void refuse(httplib::Response& response, int status, int64_t code, const std::string& message) {
    Error error(kAccessDomain, code, {{"description", message}});
    ApiReply::json(response, HostJson::error(error), status);
    // The body the client may still be sending is not read: the connection cannot be reused.
    response.set_header("Connection", "close");
}

bool isMutating(const std::string& method) {
    return method == "POST" || method == "PUT" || method == "PATCH" || method == "DELETE";
}

// Whether the body is one the content routes stream to disk rather than JSON.
bool isContentUpload(const httplib::Request& request) {
    if (request.method == "PUT" && request.path.ends_with("/content"))
        return true;
    return request.get_header_value("Content-Type").starts_with("multipart/form-data");
}

std::string trimmed(const std::string& text) {
    size_t begin = text.find_first_not_of(" \t");
    if (begin == std::string::npos)
        return "";
    size_t end = text.find_last_not_of(" \t");
    return text.substr(begin, end - begin + 1);
}

}  // namespace

AccessControl::AccessControl(std::string token) : token_(std::move(token)) {}

bool AccessControl::hostAllowed(const std::string& host) const {
    int port = port_.load();
    if (port <= 0)
        return false;
    std::string suffix = ":" + std::to_string(port);
    return host == "127.0.0.1" + suffix || host == "[::1]" + suffix || host == "localhost" + suffix;
}

bool AccessControl::originAllowed(const std::string& origin) const {
    return origin.starts_with("http://") && hostAllowed(origin.substr(7));
}

bool AccessControl::bearerMatches(const httplib::Request& request) const {
    const std::string header = request.get_header_value("Authorization");
    static const std::string kScheme = "Bearer ";
    if (!header.starts_with(kScheme))
        return false;
    return RandomToken::equal(trimmed(header.substr(kScheme.size())), token_);
}

bool AccessControl::cookieMatches(const httplib::Request& request) const {
    const std::string prefix = std::string(kCookieName) + "=";
    size_t count = request.get_header_value_count("Cookie");
    bool matched = false;
    for (size_t i = 0; i < count; ++i) {
        const std::string header = request.get_header_value("Cookie", i);
        size_t start = 0;
        while (start <= header.size()) {
            size_t end = header.find(';', start);
            if (end == std::string::npos)
                end = header.size();
            std::string pair = trimmed(header.substr(start, end - start));
            if (pair.starts_with(prefix))
                matched |= RandomToken::equal(pair.substr(prefix.size()), token_);
            start = end + 1;
        }
    }
    return matched;
}

httplib::Server::HandlerResponse AccessControl::check(const httplib::Request& request,
                                                      httplib::Response& response) const {
    using Handled = httplib::Server::HandlerResponse;
    size_t headerBytes = request.method.size() + request.target.size() + 12;
    for (const auto& [name, value] : request.headers) headerBytes += name.size() + value.size() + 4;
    if (headerBytes > kMaxHeaderBytes) {
        refuse(response, 431, 431, "request headers too large");
        return Handled::Handled;
    }
    if (!hostAllowed(request.get_header_value("Host"))) {
        refuse(response, 403, 403, "refused: not this server's host name");
        return Handled::Handled;
    }
    if (isMutating(request.method) && request.has_header("Origin") &&
        !originAllowed(request.get_header_value("Origin"))) {
        refuse(response, 403, 403, "refused: request from another origin");
        return Handled::Handled;
    }
    if (!request.path.starts_with("/api/"))
        return Handled::Unhandled;
    // Before the token is even looked at: a URL that carries it is refused outright.
    if (request.has_param("token") || request.has_param("access_token") ||
        request.target.find(token_) != std::string::npos) {
        refuse(response, 401, 401, "refused: the token belongs in a header, not the URL");
        return Handled::Handled;
    }
    // The session is only handed to whoever shows the token itself.
    bool sessionRequest = request.path == "/api/v1/session";
    bool authorized = bearerMatches(request) || (!sessionRequest && cookieMatches(request));
    if (!authorized) {
        refuse(response, 401, 401, "no or wrong access token");
        return Handled::Handled;
    }
    if (!isContentUpload(request) && request.has_header("Content-Length")) {
        const std::string length = request.get_header_value("Content-Length");
        if (length.size() > 18 || std::stoull("0" + length) > kMaxJsonBytes) {
            refuse(response, 413, 413, "request body too large");
            return Handled::Handled;
        }
    }
    return Handled::Unhandled;
}

void AccessControl::addRoutes(httplib::Server& server) const {
    server.Post("/api/v1/session", [this](const httplib::Request&, httplib::Response& response) {
        response.set_header("Set-Cookie", std::string(kCookieName) + "=" + token_ +
                                              "; HttpOnly; SameSite=Strict; Path=/");
        ApiReply::json(response, {{"session", true}});
    });
}

}  // namespace tamber
