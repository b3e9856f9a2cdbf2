#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>
#include <nlohmann/json.hpp>

namespace tamber::testing {

// A stand-in for `tamber serve` on an ephemeral loopback port: it records every request
// (method, path as sent, Authorization header, body) and answers with what the test put in
// place for "METHOD /path" (the path as decoded by the server, without the query), or 404
// with an error object.
class RecordingApiServer {
public:
    struct Request {
        std::string method;
        std::string target;  // as sent: encoded path and query
        std::string path;    // decoded, without the query
        std::string authorization;
        std::string body;
    };
    struct Answer {
        int status = 200;
        nlohmann::json body;
    };
    // Answers a stream request by writing into the sink; returning ends the stream.
    using Streamer = std::function<void(httplib::DataSink& sink)>;

    RecordingApiServer();
    ~RecordingApiServer();

    int port() const { return port_; }
    void answer(const std::string& methodAndPath, Answer answer);
    void answerStream(const std::string& path, Streamer streamer);
    std::vector<Request> requests();

private:
    void handle(const httplib::Request& request, httplib::Response& response);

    httplib::Server server_;
    std::thread thread_;
    int port_ = 0;
    std::mutex mutex_;
    std::map<std::string, Answer> answers_;
    std::map<std::string, Streamer> streams_;
    std::vector<Request> requests_;
};

}  // namespace tamber::testing
