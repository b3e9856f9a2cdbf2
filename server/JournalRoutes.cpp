#include "server/JournalRoutes.h"

#include <atomic>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "host/PublishedTrees.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/tremors/Tremors.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"
#include "server/ApiReply.h"
#include "support/DispatchQueue.h"

namespace tamber {

namespace {

constexpr auto kQuietInterval = std::chrono::seconds(15);
// How often a quiet stream looks whether its server is stopping.
constexpr auto kStopCheckInterval = std::chrono::milliseconds(200);

using StopFlag = std::shared_ptr<std::atomic<bool>>;

// The stop flag of each context the routes were added for.
std::mutex& flagsMutex() {
    static std::mutex mutex;
    return mutex;
}

std::map<const ApiContext*, StopFlag>& stopFlags() {
    static std::map<const ApiContext*, StopFlag> flags;
    return flags;
}

// What the journal's stream hands over to the connection writing it out.
struct Feed {
    std::mutex mutex;
    std::condition_variable changed;
    std::deque<std::string> lines;
    bool done = false;  // the history is replayed and the client did not ask to follow
};

std::optional<uint64_t> parseEventID(const std::string& text) {
    uint64_t value = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (text.empty() || ec != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

bool isFalse(const std::string& value) {
    return value == "0" || value == "false";
}

bool isTrue(const std::string& value) {
    return value == "1" || value == "true";
}

// A journal stream with the queue its callback runs on; stopped and released once.
struct OpenStream {
    TremorStreamRef stream = nullptr;
    std::shared_ptr<DispatchQueue> queue;

    void close() {
        if (!stream)
            return;
        TremorStreamStop(stream);
        // A batch may still be on the queue; once this passes none is, and none starts.
        queue->sync([] {});
        TremorStreamInvalidate(stream);
        TremorStreamRelease(stream);
        stream = nullptr;
    }
};

void streamEvents(const httplib::Request& request, httplib::Response& response,
                  const ApiContext& context, const StopFlag& stopping) {
    const std::string sinceText =
        request.has_param("since") ? request.get_param_value("since") : std::string("0");
    auto since = parseEventID(sinceText);
    if (!since)
        return ApiReply::error(response, ApiReply::badRequest("since takes an event ID, not \"" +
                                                              validUtf8(sinceText) + "\""));
    const bool docid = request.has_param("docid") && isTrue(request.get_param_value("docid"));
    const bool follow = !request.has_param("follow") || !isFalse(request.get_param_value("follow"));
    const uint64_t last = TremorsGetCurrentEventId();
    if (*since > last) {
        return ApiReply::error(
            response, Error(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired,
                            {{"description", "--since " + std::to_string(*since) +
                                                 " is beyond the last event " +
                                                 std::to_string(last) + " of the journal"}}));
    }
    std::vector<std::string> paths;
    const size_t count = request.get_param_value_count("path");
    for (size_t i = 0; i < count; ++i) {
        Url url = Url::fileURLWithPath(request.get_param_value("path", i));
        // Only what the server publishes: the journal holds no one else's paths for a client.
        if (auto outside = PublishedTrees::check(url); !outside.ok())
            return ApiReply::error(response, outside.error());
        paths.push_back(url.path());
    }
    if (paths.empty())
        paths.push_back(context.storage.path());

    auto feed = std::make_shared<Feed>();
    auto callback = [feed, follow](const std::vector<JournalEvent>& events) {
        std::lock_guard lock(feed->mutex);
        for (const auto& event : events) {
            feed->lines.push_back(jsonText(HostJson::journalEvent(event)) + "\n");
            if (!follow && (event.flags & kTremorHistoryDone))
                feed->done = true;
        }
        feed->changed.notify_all();
    };
    const uint32_t flags =
        kTremorCreateUseObjects | kTremorCreateFileEvents | kTremorCreateUseExtendedData;
    auto open = std::make_shared<OpenStream>();
    open->stream =
        docid ? TremorStreamCreateWithEvents(callback,
                                             TBFileObjectIdentifier::deviceID(context.storage),
                                             {kTremorDocumentIdRoot}, *since, 0.1, flags)
              : TremorStreamCreateWithEvents(callback, std::nullopt, paths, *since, 0.1, flags);
    if (!open->stream)
        return ApiReply::error(response,
                               Error(kPosixErrorDomain, EIO,
                                     {{"description", "can't open the event journal stream"}}));
    open->queue = DispatchQueue::makeSerial("tamber.server-journal");
    TremorStreamSetDispatchQueue(open->stream, open->queue);
    if (!TremorStreamStart(open->stream)) {
        TremorStreamRelease(open->stream);
        return ApiReply::error(response,
                               Error(kPosixErrorDomain, EIO,
                                     {{"description", "can't start the event journal stream"}}));
    }
    response.set_chunked_content_provider(
        "application/x-ndjson",
        [feed, stopping](size_t, httplib::DataSink& sink) {
            std::unique_lock lock(feed->mutex);
            auto quietUntil = std::chrono::steady_clock::now() + kQuietInterval;
            while (feed->lines.empty() && !feed->done) {
                if (*stopping) {
                    sink.done();
                    return true;
                }
                if (std::chrono::steady_clock::now() >= quietUntil) {
                    lock.unlock();
                    // A blank line: the client's reader skips it; a gone client fails the write.
                    return sink.write("\n", 1);
                }
                feed->changed.wait_for(lock, kStopCheckInterval);
            }
            std::deque<std::string> lines;
            lines.swap(feed->lines);
            const bool done = feed->done;
            lock.unlock();
            for (const auto& line : lines)
                if (!sink.write(line.data(), line.size()))
                    return false;
            if (done)
                sink.done();
            return true;
        },
        [open](bool) { open->close(); });
}

}  // namespace

void JournalRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    auto stopping = std::make_shared<std::atomic<bool>>(false);
    {
        std::lock_guard lock(flagsMutex());
        stopFlags()[context.get()] = stopping;
    }
    server.Get("/api/v1/journal/events",
               [context, stopping](const httplib::Request& request, httplib::Response& response) {
                   streamEvents(request, response, *context, stopping);
               });
}

void JournalRoutes::stopStreams(const ApiContext& context) {
    std::lock_guard lock(flagsMutex());
    if (auto found = stopFlags().find(&context); found != stopFlags().end()) {
        *found->second = true;
        stopFlags().erase(found);
    }
}

}  // namespace tamber
