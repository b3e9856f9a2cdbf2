#include "cli/EventsCommand.h"

#include <atomic>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <ostream>
#include <thread>

#include "cli/Interrupt.h"
#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "cli/TextEscape.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

#include "items/TBFileObjectIdentifier.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/Tremors.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

namespace {

struct Printer {
    std::ostream* out;
    std::ostream* err;
    bool json;
    bool noFollow;
    DispatchSemaphore done;
};

void printEvents(Printer& printer, const std::vector<JournalEvent>& events) {
    for (const auto& event : events) {
        if (printer.json) {
            *printer.out << jsonText(HostJson::journalEvent(event)) << "\n";
        } else {
            char hex[16];
            std::snprintf(hex, sizeof hex, "0x%05x", event.flags);
            *printer.out << event.id << " " << hex << " " << escapedText(event.path) << " "
                         << (event.fileID ? std::to_string(event.fileID) : "-") << "\n";
        }
        if (event.flags & (kTremorUserDropped | kTremorKernelDropped)) {
            // Lost history (an overflow, a tree that could not be watched, a replay from before
            // the oldest kept event): say so, since the lines above may not be complete.
            *printer.err << "tamber: warning: events under " << escapedText(event.path)
                         << " were lost ("
                         << ((event.flags & kTremorKernelDropped) ? "kernel" : "user")
                         << " side); a rescan of that tree is needed\n";
            printer.err->flush();
        }
        if (printer.noFollow && (event.flags & kTremorHistoryDone))
            printer.done.signal();
    }
    printer.out->flush();
}

}  // namespace

Status EventsCommand::watchUncovered(CliContext& context, const std::vector<std::string>& paths) {
    auto service = TremorService::shared();
    if (!service.ok())
        return service.error();
    for (const auto& path : paths) {
        if (service.value()->isWatched(path))
            continue;
        if (auto status = service.value()->watchTree(path); !status.ok()) {
            return Error(status.error().domain(), status.error().code(),
                         {{"description", "can't watch " + path + ": " +
                                              CliContext::errorMessage(status.error())}});
        }
        // Its earlier history was never journaled: say so rather than show an empty replay.
        context.err() << "tamber: warning: " << path
                      << " was not in a watched tree; watching it from now on\n";
    }
    return Status::OK();
}

CLI::App* EventsCommand::add(CLI::App& app) {
    auto* sub =
        app.add_subcommand("events", "Replay the event journal for some trees, then follow it");
    sub->add_option("PATH", paths_, "Trees to show events for (default: the document storage)");
    since_ = sub->add_option("--since", sinceText_,
                             "Replay events after this event ID (default 0: all)");
    sub->add_flag("--docid", docid_, "Show document-ID events instead of path events");
    sub->add_flag("--no-follow", noFollow_, "Stop after the history has been replayed");
    addJsonFlag(sub, "One JSON object per line: id, flags, path, fileID");
    sub->add_option("--forget", forget_,
                    "Stop watching a remembered tree and drop its index entries (its "
                    "identifiers no longer resolve; its events stay)");
    return sub;
}

int EventsCommand::forget(CliContext& context) {
    if (!paths_.empty()) {
        return context.fail(CliContext::usageError("--forget takes one tree and no other PATH"),
                            json_);
    }
    // Nothing is watched for this: forgetting one tree must not cost a crawl of the others.
    auto service = context.startJournal();
    if (!service.ok())
        return context.fail(service.error(), json_);
    std::string path = Url::fileURLWithPath(forget_).path();
    auto forgotten = service.value()->forget(path);
    if (!forgotten.ok()) {
        return context.fail(
            Error(forgotten.error().domain(), forgotten.error().code(),
                  {{"description",
                    "can't forget " + path + ": " + CliContext::errorMessage(forgotten.error())}}),
            json_);
    }
    const auto& outcome = forgotten.value();
    if (json_) {
        context.out() << nlohmann::json{{"forgotten", path},
                                        {"entries", outcome.entries},
                                        {"documents", outcome.documents}}
                             .dump()
                      << "\n";
    } else {
        context.out() << "forgot " << path << ": " << outcome.entries << " index entries, "
                      << outcome.documents << " document IDs\n";
    }
    return 0;
}

std::optional<uint64_t> EventsCommand::parseEventID(const std::string& text) {
    // Digits only: a sign, a space, a base prefix or a trailing letter is a mistake to point
    // out, not a number to guess at.
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos)
        return std::nullopt;
    uint64_t value = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

std::optional<int> EventsCommand::runBeforeProvider(CliContext& context) {
    // The journal belongs to the server while it runs: forgetting a tree here would wait for
    // its lock.
    if (const auto& server = context.server(); server && !forget_.empty()) {
        const std::string pid = std::to_string(server->pid);
        return context.fail(Error(kPosixErrorDomain, EBUSY,
                                  {{"description", "the Tamber server (pid " + pid +
                                                       ") holds the event journal; stop it (kill " +
                                                       pid + ") to forget a tree"}}),
                            json_);
    }
    if (forget_.empty())
        return std::nullopt;
    return forget(context);
}

Status EventsCommand::checkArguments() {
    std::optional<uint64_t> since = since_->count() ? parseEventID(sinceText_) : uint64_t{0};
    if (!since) {
        return CliContext::usageError("--since takes an event ID (0 to " +
                                      std::to_string(UINT64_MAX) + "), not \"" + sinceText_ + "\"");
    }
    sinceID_ = *since;
    return Status::OK();
}

// The trees of this run are those it publishes (the provider is started for that), and the
// paths asked for here.
int EventsCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    if (auto* remote = dynamic_cast<RemotePorter*>(&provider))
        return runThroughServer(context, *remote);
    // A replay from past the journal's end has nothing to show and never ends: an ID from
    // another journal, or mistyped.
    const uint64_t last = TremorsGetCurrentEventId();
    if (sinceID_ > last) {
        return fail(context,
                    Error(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired,
                          {{"description", "--since " + std::to_string(sinceID_) +
                                               " is beyond the last event " + std::to_string(last) +
                                               " of the journal"}}));
    }
    std::vector<std::string> paths;
    for (const auto& p : paths_) paths.push_back(Url::fileURLWithPath(p).path());
    if (paths.empty())
        paths.push_back(context.storageURL().path());

    if (!docid_) {
        if (auto status = watchUncovered(context, paths); !status.ok())
            return fail(context, status.error());
    }

    Printer printer{&context.out(), &context.err(), json_, noFollow_, DispatchSemaphore(0)};
    uint32_t flags =
        kTremorCreateUseObjects | kTremorCreateFileEvents | kTremorCreateUseExtendedData;
    auto print = [&printer](const std::vector<JournalEvent>& events) {
        printEvents(printer, events);
    };
    TremorStreamRef stream =
        docid_ ? TremorStreamCreateWithEvents(
                     print, TBFileObjectIdentifier::deviceID(context.storageURL()),
                     {kTremorDocumentIdRoot}, sinceID_, 0.1, flags)
               : TremorStreamCreateWithEvents(print, std::nullopt, paths, sinceID_, 0.1, flags);
    if (!stream) {
        return fail(context, Error(kPosixErrorDomain, EIO,
                                   {{"description", "can't open the event journal stream"}}));
    }
    auto queue = DispatchQueue::makeSerial("tamber.cli-events");
    TremorStreamSetDispatchQueue(stream, queue);
    catchInterrupts();
    if (!TremorStreamStart(stream)) {
        TremorStreamRelease(stream);
        return fail(context, Error(kPosixErrorDomain, EIO,
                                   {{"description", "can't start the event journal stream"}}));
    }
    // Without --no-follow nothing signals `done`: only an interrupt ends the wait.
    while (!interrupted() && !printer.done.wait(0.2)) {
    }
    TremorStreamStop(stream);
    // A batch may still be printing on the stream's queue; once this barrier passes none is,
    // and a stopped stream starts no other, so `printer` can go.
    queue->sync([] {});
    TremorStreamInvalidate(stream);
    TremorStreamRelease(stream);
    return 0;
}

int EventsCommand::runThroughServer(CliContext& context, RemotePorter& provider) {
    std::string path = "journal/events?since=" + std::to_string(sinceID_);
    if (docid_)
        path += "&docid=1";
    if (noFollow_)
        path += "&follow=0";
    for (const auto& p : paths_)
        path += "&path=" + ServerClient::encode(Url::fileURLWithPath(p).path());

    Printer printer{&context.out(), &context.err(), json_, noFollow_, DispatchSemaphore(0)};
    ServerClient client(provider.client().server());
    std::string pending;  // the start of a line whose end has not arrived
    std::optional<Error> malformed;
    auto receive = [&](std::string_view piece) {
        pending.append(piece);
        size_t start = 0;
        for (size_t end; (end = pending.find('\n', start)) != std::string::npos; start = end + 1) {
            if (end == start)
                continue;  // the server's sign of life
            auto record =
                nlohmann::json::parse(pending.begin() + static_cast<long>(start),
                                      pending.begin() + static_cast<long>(end), nullptr, false);
            auto event = HostJson::journalEventFromJson(record);
            if (!event) {
                malformed = Error(kPosixErrorDomain, EPROTO,
                                  {{"description", "the Tamber server sent a malformed event"}});
                return false;
            }
            printEvents(printer, {*event});
        }
        pending.erase(0, start);
        return true;
    };
    catchInterrupts();
    std::atomic<bool> ended = false;
    Status streamed;
    std::thread reader([&] {
        streamed = client.stream(path, receive);
        ended = true;
    });
    while (!interrupted() && !ended) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    client.stop();
    reader.join();
    if (malformed)
        return fail(context, *malformed);
    if (!streamed.ok())
        return fail(context, streamed.error());
    if (!interrupted() && !noFollow_)
        return fail(
            context,
            Error(kPosixErrorDomain, ECONNRESET,
                  {{"description", "the Tamber server (pid " + std::to_string(client.server().pid) +
                                       ") ended the stream of events"}}));
    return 0;
}

}  // namespace tamber
