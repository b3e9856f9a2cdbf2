#pragma once

#include <functional>
#include <iosfwd>
#include <memory>
#include <mutex>
#include <string>

#include <nlohmann/json.hpp>

#include "platform/Url.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"

namespace tamber {

// What every verb shares: the global options, the output streams and the error convention.
class CliContext {
public:
    CliContext(std::ostream& out, std::ostream& err);

    std::string storagePath;  // --storage; empty means ~/Documents
    bool debug = false;       // --debug
    bool verbose = false;     // --verbose

    // Resolves and creates the document storage folder and installs the host manager for it.
    // Fails when the folder cannot be created.
    Status prepareStorage();
    const Url& storageURL() const { return storage_; }
    // Starts the event journal and its document-ID service and watches the storage folder, so
    // that identifiers can be given and resolved.
    Status prepareJournal();
    // Runs the provider as a small host would: starts the journal, refreshes the app libraries
    // from the installed applications, upgrades the shared manager, watches every published
    // tree, and hands back the provider. Later calls return the same provider.
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
};

}  // namespace tamber
