#include "cli/WatchCommand.h"

#include <atomic>
#include <cerrno>
#include <chrono>
#include <mutex>
#include <ostream>
#include <thread>

#include "cli/ContainerArgument.h"
#include "cli/Interrupt.h"
#include "cli/RemoteEventStream.h"
#include "cli/ServerClient.h"
#include "platform/objects/Date.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* WatchCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "watch", "Print each change signal the provider sends for a container, until Ctrl-C");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root (default), working-set, "
                    "all-directories");
    addJsonFlag(sub, R"(One {"container": ID, "date": ISO-8601} a line)");
    return sub;
}

void WatchCommand::printSignal(CliContext& context, const std::string& container) {
    std::string date = Date::now()->iso8601();
    if (json_)
        context.out() << jsonText(nlohmann::json{{"container", container}, {"date", date}});
    else
        context.out() << date << "\t" << container;
    context.out() << std::endl;
}

int WatchCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    if (context.server())
        return watchServer(context, provider);
    std::mutex outMutex;
    // Installed before the enumerator exists, so that no signal of its start is missed.
    context.setSignalHandler([&](const HostPorterItemIdentifier& container) {
        std::lock_guard lock(outMutex);
        printSignal(context, container);
    });
    auto container = ContainerArgument::resolve(provider, container_);
    if (!container.ok()) {
        context.setSignalHandler({});
        return fail(context, container.error());
    }
    catchInterrupts();
    while (!interrupted()) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    container.value().enumerator->invalidate();
    context.setSignalHandler({});
    return 0;
}

int WatchCommand::watchServer(CliContext& context, HostPorterExtension& provider) {
    // The same refusals as a direct run: a container that does not exist or cannot be listed.
    auto container = ContainerArgument::resolve(provider, container_);
    if (!container.ok())
        return fail(context, container.error());
    container.value().enumerator->invalidate();

    ServerClient client(*context.server());
    RemoteEventStream events([&](const RemoteEventStream::Event& event) {
        if (event.type != "signal")
            return;
        auto body = nlohmann::json::parse(event.data, nullptr, false);
        if (body.is_object() && body.contains("container") && body["container"].is_string())
            printSignal(context, body["container"].get<std::string>());
    });
    catchInterrupts();
    std::atomic<bool> ended = false;
    Status streamed;
    std::thread reader([&] {
        streamed = client.stream("events", [&](std::string_view piece) {
            events.feed(piece);
            return true;
        });
        ended = true;
    });
    while (!interrupted() && !ended) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    client.stop();
    reader.join();
    if (!streamed.ok())
        return fail(context, streamed.error());
    if (!interrupted())
        return fail(context, Error(kPosixErrorDomain, ECONNRESET,
                                   {{"description", "the Tamber server (pid " +
                                                        std::to_string(context.server()->pid) +
                                                        ") ended the stream of events"}}));
    return 0;
}

}  // namespace tamber
