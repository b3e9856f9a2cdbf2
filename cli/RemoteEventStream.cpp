#include "cli/RemoteEventStream.h"

#include <utility>

namespace tamber {

RemoteEventStream::RemoteEventStream(Handler handler) : handler_(std::move(handler)) {}

void RemoteEventStream::feed(std::string_view piece) {
    pending_.append(piece);
    size_t start = 0;
    for (size_t end; (end = pending_.find('\n', start)) != std::string::npos; start = end + 1) {
        std::string_view text(pending_.data() + start, end - start);
        if (!text.empty() && text.back() == '\r')
            text.remove_suffix(1);
        line(text);
    }
    pending_.erase(0, start);
}

void RemoteEventStream::line(std::string_view text) {
    if (text.empty()) {
        if (std::exchange(started_, false)) {
            // Each data line ended with "\n"; the last one is not part of the data.
            if (!event_.data.empty())
                event_.data.pop_back();
            handler_(event_);
            event_ = Event();
        }
        return;
    }
    if (text.front() == ':')
        return;
    const size_t colon = text.find(':');
    std::string_view field = text.substr(0, colon);
    std::string_view value;
    if (colon != std::string_view::npos) {
        value = text.substr(colon + 1);
        if (!value.empty() && value.front() == ' ')
            value.remove_prefix(1);
    }
    if (field == "data") {
        event_.data.append(value);
        event_.data += '\n';
    } else if (field == "event") {
        event_.type = value;
    } else if (field == "id") {
        event_.id = value;
    } else {
        return;  // unknown fields (retry) change nothing here
    }
    started_ = true;
}

}  // namespace tamber
