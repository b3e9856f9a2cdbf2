#include "tests/cli/RecordingApiServer.h"

#include "runtime/JsonValues.h"

namespace tamber::testing {

RecordingApiServer::RecordingApiServer() {
    auto handler = [this](const httplib::Request& request, httplib::Response& response) {
        handle(request, response);
    };
    server_.Get(".*", handler);
    server_.Post(".*", handler);
    server_.Patch(".*", handler);
    server_.Delete(".*", handler);
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    // Bound and listening already: a connection made before the loop starts waits for it.
}

RecordingApiServer::~RecordingApiServer() {
    server_.stop();
    thread_.join();
}

void RecordingApiServer::answer(const std::string& methodAndPath, Answer answer) {
    std::lock_guard lock(mutex_);
    answers_[methodAndPath] = std::move(answer);
}

void RecordingApiServer::answerStream(const std::string& path, Streamer streamer) {
    std::lock_guard lock(mutex_);
    streams_[path] = std::move(streamer);
}

std::vector<RecordingApiServer::Request> RecordingApiServer::requests() {
    std::lock_guard lock(mutex_);
    return requests_;
}

void RecordingApiServer::handle(const httplib::Request& request, httplib::Response& response) {
    std::lock_guard lock(mutex_);
    requests_.push_back({request.method, request.target, request.path,
                         request.get_header_value("Authorization"), request.body});
    if (auto stream = streams_.find(request.path); stream != streams_.end()) {
        Streamer streamer = stream->second;
        response.set_chunked_content_provider("text/event-stream",
                                              [streamer](size_t, httplib::DataSink& sink) {
                                                  streamer(sink);
                                                  sink.done();
                                                  return true;
                                              });
        return;
    }
    auto found = answers_.find(request.method + " " + request.path);
    if (found == answers_.end()) {
        response.status = 404;
        response.set_content(jsonText({{"error",
                                        {{"domain", "HostPorterErrorDomain"},
                                         {"code", -1005},
                                         {"message", "no such route: " + request.path}}}}),
                             "application/json");
        return;
    }
    response.status = found->second.status;
    response.set_content(jsonText(found->second.body), "application/json");
}

}  // namespace tamber::testing
