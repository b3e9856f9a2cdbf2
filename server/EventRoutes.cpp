#include "server/EventRoutes.h"

#include <charconv>
#include <string>
#include <vector>

#include "server/ApiReply.h"
#include "server/EventHub.h"
#include "server/HostReplica.h"
#include "server/RouteSupport.h"

namespace tamber {

namespace {

// The state of one stream, kept by its content provider.
struct Stream {
    std::shared_ptr<EventHub> hub;
    std::shared_ptr<EventHub::Subscriber> subscriber;
    std::vector<EventHub::Event> pending;  // the replay, sent first
    uint64_t lastSent = 0;                 // batches up to this one were sent
    ~Stream() { hub->unsubscribe(subscriber); }
};

bool send(httplib::DataSink& sink, const std::string& text) {
    return sink.write(text.data(), text.size());
}

}  // namespace

void EventRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    server.Get("/api/v1/events", [context](const httplib::Request& request,
                                           httplib::Response& response) {
        if (!context->events)
            return ApiReply::error(response, Error(kPosixErrorDomain, ENOTSUP,
                                                   {{"description", "no event stream here"}}));
        std::optional<uint64_t> lastEventId;
        if (request.has_header("Last-Event-ID")) {
            const std::string text = request.get_header_value("Last-Event-ID");
            uint64_t value = 0;
            auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
            if (ec != std::errc() || end != text.data() + text.size())
                return RouteSupport::replyBadRequest(response, "Last-Event-ID must be a number");
            lastEventId = value;
        }
        auto stream = std::make_shared<Stream>();
        stream->hub = context->events;
        // Subscribed before the replay is read, so that no batch falls between the two; one
        // that is in both is sent once.
        stream->subscriber = context->events->subscribe();
        // A stream opens with a comment, so that the client sees at once that it is live.
        stream->pending.push_back({0, ": connected\n\n"});
        if (lastEventId && context->replica) {
            auto missed = context->replica->batchesSince(*lastEventId);
            if (missed.ok()) {
                for (const auto& batch : missed.value())
                    stream->pending.push_back(EventHub::batchEvent(batch));
            } else {
                stream->pending.push_back(EventHub::resetEvent());
            }
            stream->lastSent = *lastEventId;
        }
        response.set_header("Cache-Control", "no-store");
        response.set_header("X-Accel-Buffering", "no");
        response.set_chunked_content_provider(
            "text/event-stream", [stream](size_t, httplib::DataSink& sink) {
                auto deliver = [&](std::vector<EventHub::Event>& events) {
                    for (const auto& event : events) {
                        if (event.sequence != 0) {
                            if (event.sequence <= stream->lastSent)
                                continue;
                            stream->lastSent = event.sequence;
                        }
                        if (!send(sink, event.text))
                            return false;
                    }
                    return true;
                };
                if (!stream->pending.empty()) {
                    std::vector<EventHub::Event> replay;
                    replay.swap(stream->pending);
                    return deliver(replay);
                }
                if (!stream->subscriber->open()) {
                    sink.done();
                    return true;
                }
                auto events = stream->subscriber->next(kKeepAlive);
                if (!stream->subscriber->open()) {
                    sink.done();
                    return true;
                }
                if (events.empty())
                    return send(sink, ": keep-alive\n\n");
                return deliver(events);
            });
    });
}

}  // namespace tamber
