#pragma once

#include <functional>
#include <iosfwd>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/Url.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorter.h"
#include "runtime/ProviderRuntime.h"
#include "runtime/RunFile.h"
#include "support/Error.h"

namespace tamber {

class RemotePorter;

// What every verb shares: the global options, the output streams and the error convention.
class CliContext {
public:
    static constexpr double kDefaultWaitSeconds = 10;

    CliContext(std::ostream& out, std::ostream& err);
    // The run ends: the trees it did not publish are marked unwatched in the journal.
    ~CliContext();
    CliContext(const CliContext&) = delete;
    CliContext& operator=(const CliContext&) = delete;

    std::string storagePath;                   // --storage; empty means ~/Documents
    bool debug = false;                        // --debug
    bool verbose = false;                      // --verbose
    double waitSeconds = kDefaultWaitSeconds;  // --wait: for another process using the journal
    bool direct = false;                       // --direct: never through a running server
    Url runFile = RunFile::defaultLocation();  // where a running server says where it is

    // Looks for a live server of this storage folder (after prepareStorage()). Without --direct
    // the verbs are then answered through it; with --direct a server refuses the run, since it
    // holds the journal: the error names its process.
    Status discoverServer();
    // The server the verbs go through, if any.
    const std::optional<RunFileRecord>& server() const { return server_; }
    // The server's provider, as the verbs use one; null without a server. The app libraries
    // last found are published here too, so that paths are checked as a direct run checks them.
    Result<std::shared_ptr<RemotePorter>> remoteProvider();

    // Creates the run's runtime from the global options: resolves and creates the document
    // storage folder and installs the host manager for it. Fails when the folder cannot be
    // created. The start-up steps below are the runtime's (see ProviderRuntime).
    Status prepareStorage();
    const Url& storageURL() const;
    // Starts the event journal and its document-ID service, watching nothing yet. When another
    // process holds the journal, waits up to waitSeconds for it, saying so once on standard
    // error; the error names that process.
    Result<std::shared_ptr<TremorService>> startJournal();
    // Starts the journal and watches the storage folder.
    Status prepareJournal();
    // The provider, started as ProviderRuntime::provider() says.
    Result<std::shared_ptr<LocalPorter>> prepareProvider();
    const LocalPorter::AppRefreshOutcome& appRefreshOutcome() const;
    // Publishes the app libraries last found without starting the provider, as
    // ProviderRuntime::publishFromCache() says; the storage folder is not prepared for it.
    Status publishFromCache();

    // Receives the container signals the provider sends to the host (a watching verb prints
    // them); may be called on any thread.
    using SignalHandler = std::function<void(const HostPorterItemIdentifier&)>;
    void setSignalHandler(SignalHandler handler);

    std::ostream& out() { return out_; }
    std::ostream& err() { return err_; }

    // The exit statuses, the same for every verb; scripts rely on them.
    static constexpr int kExitSuccess = 0;
    static constexpr int kExitFailure = 1;   // the verb ran and failed
    static constexpr int kExitUsage = 2;     // bad option, missing argument, bad value
    static constexpr int kExitNotFound = 3;  // no such item, identifier or path

    // The verb being run and its positional arguments, so that a failure can say which
    // argument it was about when its message does not.
    void setInvocation(std::string verb, std::vector<std::string> arguments);

    // Prints the error (as {"error": {...}} on standard output with --json, else one line
    // "tamber: <message>" on standard error; with --verbose or --debug the line also names the
    // error's domain and code) and returns the exit status for it.
    int fail(const Error& error, bool json);
    // The exit status for an error: usage errors 2, errors that say something does not exist
    // 3, anything else 1.
    static int exitStatusFor(const Error& error);
    // An error for bad command-line input; `message` names the option or argument and the
    // value.
    static Error usageError(const std::string& message);
    static bool isUsageError(const Error& error);
    // An unexpected failure (an exception) inside the program.
    static Error internalError(const std::string& what);

    static nlohmann::json errorJson(const Error& error);
    // The message of an error, without the domain and code decoration.
    static std::string errorMessage(const Error& error);
    // The line printed for an error on standard error, without "tamber: ": the message, led by
    // the verb and its arguments when the message names none of them.
    std::string failureLine(const Error& error) const;

private:
    // The run's runtime, made from the global options on first use.
    ProviderRuntime& runtime();

    std::ostream& out_;
    std::ostream& err_;
    std::string verb_;
    std::vector<std::string> arguments_;
    std::unique_ptr<ProviderRuntime> runtime_;  // made by prepareStorage()
    std::optional<RunFileRecord> server_;
    std::shared_ptr<RemotePorter> remote_;
    // Where the notice of a wait for the journal goes; the journal may outlive this context.
    struct WaitNotice {
        std::mutex mutex;
        std::ostream* err = nullptr;
        bool told = false;
    };
    std::shared_ptr<WaitNotice> waitNotice_ = std::make_shared<WaitNotice>();
};

}  // namespace tamber
