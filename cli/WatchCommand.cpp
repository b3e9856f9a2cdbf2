#include "cli/WatchCommand.h"

#include <chrono>
#include <mutex>
#include <ostream>
#include <thread>

#include "cli/ContainerArgument.h"
#include "cli/Interrupt.h"
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

int WatchCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    std::mutex outMutex;
    // Installed before the enumerator exists, so that no signal of its start is missed.
    context.setSignalHandler([&](const HostPorterItemIdentifier& container) {
        std::lock_guard lock(outMutex);
        std::string date = Date::now()->iso8601();
        if (json_)
            context.out() << jsonText(nlohmann::json{{"container", container}, {"date", date}});
        else
            context.out() << date << "\t" << container;
        context.out() << std::endl;
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

}  // namespace tamber
