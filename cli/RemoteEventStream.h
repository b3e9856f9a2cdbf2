#pragma once

#include <functional>
#include <string>
#include <string_view>

namespace tamber {

// Reads a stream of Server-Sent Events as it arrives in pieces of any size: lines end with
// "\n" (a "\r" before it is dropped), "field: value" lines build an event, comment lines
// (":" first) are skipped, and an empty line hands the event over. Data lines are joined with
// "\n".
class RemoteEventStream {
public:
    struct Event {
        std::string id;
        std::string type = "message";
        std::string data;
    };
    using Handler = std::function<void(const Event& event)>;

    explicit RemoteEventStream(Handler handler);

    void feed(std::string_view piece);

private:
    void line(std::string_view text);

    Handler handler_;
    std::string pending_;  // the start of a line whose end has not arrived
    Event event_;
    bool started_ = false;  // a field of event_ was set
};

}  // namespace tamber
