#include "cli/ServerClient.h"

#include <cerrno>
#include <utility>

#include <httplib.h>

#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

namespace tamber {

namespace {

constexpr const char* kApiPrefix = "/api/v1/";
constexpr const char* kJsonType = "application/json";

}  // namespace

ServerClient::ServerClient(RunFileRecord server) : server_(std::move(server)) {}

ServerClient::~ServerClient() = default;

std::string ServerClient::encode(std::string_view text) {
    static const char* const kHex = "0123456789ABCDEF";
    std::string encoded;
    encoded.reserve(text.size());
    for (unsigned char c : text) {
        const bool plain = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
                           (c >= '0' && c <= '9') || c == '-' || c == '.' || c == '_' || c == '~';
        if (plain) {
            encoded += static_cast<char>(c);
        } else {
            encoded += '%';
            encoded += kHex[c >> 4];
            encoded += kHex[c & 0xF];
        }
    }
    return encoded;
}

std::unique_ptr<httplib::Client> ServerClient::makeClient(int readTimeoutSeconds) const {
    // Loopback by number: the server listens there, and its Host check expects that name.
    auto client = std::make_unique<httplib::Client>("127.0.0.1", server_.port);
    client->set_connection_timeout(kConnectTimeoutSeconds);
    client->set_read_timeout(readTimeoutSeconds);
    client->set_write_timeout(kChangeTimeoutSeconds);
    // Paths arrive encoded; a second encoding would change the identifiers in them.
    client->set_url_encode(false);
    client->set_default_headers({{"Authorization", "Bearer " + server_.token}});
    return client;
}

Error ServerClient::unreachable(const std::string& why) const {
    // A server that was killed leaves its run file behind, and its process ID may be reused.
    return Error(kPosixErrorDomain, ECONNREFUSED,
                 {{"description", "the Tamber server (pid " + std::to_string(server_.pid) +
                                      ", port " + std::to_string(server_.port) +
                                      ") did not answer: " + why + "; if it is not running, " +
                                      "remove " + RunFile::defaultLocation().path()}});
}

Error ServerClient::failure(const Reply& reply) const {
    auto body = nlohmann::json::parse(reply.body, nullptr, false);
    if (auto error = HostJson::errorFromJson(body))
        return *error;
    return Error(
        kPosixErrorDomain, EPROTO,
        {{"description", "the Tamber server (pid " + std::to_string(server_.pid) +
                             ") answered with HTTP status " + std::to_string(reply.status)}});
}

Result<ServerClient::Reply> ServerClient::send(const std::string& method, const std::string& path,
                                               const std::string* body) {
    auto client = makeClient(method == "GET" ? kReadTimeoutSeconds : kChangeTimeoutSeconds);
    const std::string target = kApiPrefix + path;
    const std::string payload = body ? *body : std::string();
    httplib::Result result = [&] {
        if (method == "GET")
            return client->Get(target);
        if (method == "POST")
            return client->Post(target, payload, kJsonType);
        if (method == "PATCH")
            return client->Patch(target, payload, kJsonType);
        return client->Delete(target);
    }();
    if (!result)
        return unreachable(httplib::to_string(result.error()));
    return Reply{result->status, result->body};
}

Result<nlohmann::json> ServerClient::json(const std::string& method, const std::string& path,
                                          const nlohmann::json* body) {
    std::string text;
    if (body)
        text = jsonText(*body);
    auto reply = send(method, path, body ? &text : nullptr);
    if (!reply.ok())
        return reply.error();
    if (reply.value().status < 200 || reply.value().status >= 300)
        return failure(reply.value());
    auto parsed = nlohmann::json::parse(reply.value().body, nullptr, false);
    if (parsed.is_discarded())
        return Error(kPosixErrorDomain, EPROTO,
                     {{"description", "the Tamber server (pid " + std::to_string(server_.pid) +
                                          ") answered with something that is not JSON"}});
    return parsed;
}

Result<nlohmann::json> ServerClient::get(const std::string& path) {
    return json("GET", path, nullptr);
}

Result<nlohmann::json> ServerClient::post(const std::string& path, const nlohmann::json& body) {
    return json("POST", path, &body);
}

Result<nlohmann::json> ServerClient::patch(const std::string& path, const nlohmann::json& body) {
    return json("PATCH", path, &body);
}

Result<nlohmann::json> ServerClient::remove(const std::string& path) {
    return json("DELETE", path, nullptr);
}

Result<std::string> ServerClient::getBytes(const std::string& path) {
    auto reply = send("GET", path, nullptr);
    if (!reply.ok())
        return reply.error();
    if (reply.value().status < 200 || reply.value().status >= 300)
        return failure(reply.value());
    return std::move(reply.value().body);
}

Status ServerClient::stream(const std::string& path,
                            std::function<bool(std::string_view piece)> receive) {
    auto client = makeClient(kStreamTimeoutSeconds);
    {
        std::lock_guard lock(mutex_);
        if (stopped_)
            return Status::OK();
        streaming_ = client.get();
    }
    int status = 0;
    std::string refusal;
    auto result = client->Get(
        kApiPrefix + path,
        [&](const httplib::Response& response) {
            status = response.status;
            return true;
        },
        [&](const char* data, size_t length) {
            if (status < 200 || status >= 300) {
                refusal.append(data, length);
                return true;
            }
            return receive(std::string_view(data, length)) && !stopped_;
        });
    {
        std::lock_guard lock(mutex_);
        streaming_ = nullptr;
    }
    if (stopped_)
        return Status::OK();
    if (status != 0 && (status < 200 || status >= 300))
        return failure(Reply{status, refusal});
    if (!result && result.error() != httplib::Error::Canceled)
        return unreachable(httplib::to_string(result.error()));
    return Status::OK();
}

void ServerClient::stop() {
    std::lock_guard lock(mutex_);
    stopped_ = true;
    if (streaming_)
        streaming_->stop();
}

}  // namespace tamber
