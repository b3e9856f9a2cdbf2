#include "cli/ServeCommand.h"

#include <spawn.h>
#include <sys/wait.h>

#include <chrono>
#include <cstdlib>
#include <ostream>
#include <thread>

#include "cli/Interrupt.h"
#include "server/TamberServer.h"
#include "support/Log.h"

extern char** environ;

namespace tamber {

namespace {

// Hands the URL to the desktop's browser, when there is a desktop; a failure is only logged.
void openInBrowser(const std::string& url) {
    const char* x11 = std::getenv("DISPLAY");
    const char* wayland = std::getenv("WAYLAND_DISPLAY");
    if (!(x11 && *x11) && !(wayland && *wayland))
        return;
    std::string program = "xdg-open";
    char* argv[] = {program.data(), const_cast<char*>(url.c_str()), nullptr};
    pid_t child = 0;
    if (::posix_spawnp(&child, "xdg-open", nullptr, nullptr, argv, environ) != 0) {
        logInfo("could not run xdg-open");
        return;
    }
    // Reaped on a thread of its own: xdg-open may wait for the browser.
    std::thread([child] {
        int status = 0;
        ::waitpid(child, &status, 0);
    }).detach();
}

}  // namespace

CLI::App* ServeCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "serve",
        "Run the Tamber server for the storage folder (HTTP API on 127.0.0.1 and ::1) until "
        "interrupted");
    sub->add_option("--port", port_, "The port to listen on (default 8177; 0 picks a free one)")
        ->check(CLI::Range(0, 65535));
    sub->add_flag("--no-open", noOpen_, "Do not open the URL in a browser");
    sub->add_option("--web-root", webRoot_,
                    "Serve the web page's files from this folder instead of the built-in ones "
                    "(for working on the page)")
        ->check(CLI::ExistingDirectory);
    return sub;
}

int ServeCommand::run(CliContext& context) {
    catchInterrupts();
    TamberServerOptions options;
    options.storagePath = context.storageURL().path();
    options.port = port_;
    options.webRoot = webRoot_;
    options.replicaFactory = HostReplica::open;
    TamberServer server(std::move(options));
    if (auto started = server.start(); !started.ok()) {
        server.stop();
        return context.fail(started.error(), false);
    }
    context.out() << server.url() << std::endl;
    if (!noOpen_)
        openInBrowser(server.url());

    // The service manager hears that the server is ready once its first catch-up is done.
    std::thread readiness([&server] {
        while (!interrupted() && !server.waitUntilReady(std::chrono::milliseconds(200))) {
        }
    });
    while (!interrupted()) std::this_thread::sleep_for(std::chrono::milliseconds(100));
    readiness.join();
    logInfo("stopping the server");
    server.stop();
    return CliContext::kExitSuccess;
}

}  // namespace tamber
