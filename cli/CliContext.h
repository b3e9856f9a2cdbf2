#pragma once

#include <functional>
#include <iosfwd>
#include <memory>
#include <mutex>
#include <string>

#include <nlohmann/json.hpp>

#include "platform/Url.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"

namespace tamber {

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

    // Resolves and creates the document storage folder and installs the host manager for it.
    // Fails when the folder cannot be created.
    Status prepareStorage();
    const Url& storageURL() const { return storage_; }
    // Starts the event journal and its document-ID service, watching nothing yet. When another
    // process holds the journal, waits up to waitSeconds for it, saying so once on standard
    // error; the error names that process.
    Result<std::shared_ptr<TremorService>> startJournal();
    // Starts the journal and watches the storage folder, so that identifiers can be given and
    // resolved.
    Status prepareJournal();
    // Runs the provider as a small host would: starts the journal, refreshes the app libraries
    // from the installed applications, upgrades the shared manager, watches every published
    // tree, and hands back the provider. Later calls return the same provider. What this run
    // publishes is then known: when it ends, the trees the journal remembers but this run did
    // not watch are marked unwatched.
    Result<std::shared_ptr<LocalPorter>> prepareProvider();
    const LocalPorter::AppRefreshOutcome& appRefreshOutcome() const { return refreshOutcome_; }

    // Receives the container signals the provider sends to the host (a watching verb prints
    // them); may be called on any thread.
    using SignalHandler = std::function<void(const HostPorterItemIdentifier&)>;
    void setSignalHandler(SignalHandler handler);

    std::ostream& out() { return out_; }
    std::ostream& err() { return err_; }

    // Prints the error (as {"error": {...}} on standard output with --json, else a line on
    // standard error) and returns the exit status to use.
    int fail(const Error& error, bool json);
    // An error for bad command-line input.
    static Error usageError(const std::string& message);

    static nlohmann::json errorJson(const Error& error);
    // The message of an error, without the domain and code decoration.
    static std::string errorMessage(const Error& error);

private:
    std::ostream& out_;
    std::ostream& err_;
    Url storage_;
    std::shared_ptr<LocalPorter> porter_;
    struct SignalSlot {
        std::mutex mutex;
        SignalHandler handler;
    };
    std::shared_ptr<SignalSlot> signals_ = std::make_shared<SignalSlot>();
    LocalPorter::AppRefreshOutcome refreshOutcome_;
    // Where the notice of a wait for the journal goes; the journal may outlive this context.
    struct WaitNotice {
        std::mutex mutex;
        std::ostream* err = nullptr;
        bool told = false;
    };
    std::shared_ptr<WaitNotice> waitNotice_ = std::make_shared<WaitNotice>();
    std::shared_ptr<TremorService> publishing_;  // set once the run's publication is known
};

}  // namespace tamber
