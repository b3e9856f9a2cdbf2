#pragma once

#include <iosfwd>
#include <string>

#include <nlohmann/json.hpp>

#include "platform/Url.h"
#include "support/Error.h"

namespace tamber {

// What every verb shares: the global options, the output streams and the error convention.
class CliContext {
public:
    CliContext(std::ostream& out, std::ostream& err);

    std::string storagePath;  // --storage; empty means ~/Documents
    bool debug = false;       // --debug

    // Resolves and creates the document storage folder and installs the host manager for it.
    // Fails when the folder cannot be created.
    Status prepareStorage();
    const Url& storageURL() const { return storage_; }
    // Starts the event journal and its document-ID service and watches the storage folder, so
    // that identifiers can be given and resolved.
    Status prepareJournal();

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
};

}  // namespace tamber
