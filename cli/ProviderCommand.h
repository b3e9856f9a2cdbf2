#pragma once

#include <optional>
#include <string>

#include "cli/Command.h"
#include "host/HostPorterExtension.h"
#include "support/Result.h"

namespace tamber {

// A verb that works through the provider. It runs the shared preamble once for all of them: a
// verb may first answer without the provider (the journal's --forget), then the arguments that
// can be checked without the provider are checked (a usage error wins), then the provider is
// prepared (or, when a server of the storage is running, the provider that answers through its
// API), then the verb runs against the host interface. Failures print in the form --json
// asked for.
class ProviderCommand : public Command {
public:
    int run(CliContext& context) final;

protected:
    // An exit status when the verb is done before the provider starts; nothing by default.
    virtual std::optional<int> runBeforeProvider(CliContext&) { return std::nullopt; }
    // What can be refused before the provider starts; nothing by default.
    virtual Status checkArguments() { return Status::OK(); }
    // The verb itself; returns the exit status.
    virtual int runWith(CliContext& context, HostPorterExtension& provider) = 0;

    // Declares --json on `verb` with `help` saying what it prints.
    void addJsonFlag(CLI::App* verb, const std::string& help);
    // Prints the error as --json asked and returns its exit status.
    int fail(CliContext& context, const Error& error) const { return context.fail(error, json_); }
    // Prints an item as `tamber item` does (with --json, exactly its JSON); returns 0.
    int printItem(CliContext& context, const HostPorterItem& item) const;
    // Prints an operation's item, or fails with its error.
    int finish(CliContext& context, const Result<HostPorterItemRef>& item) const;

    bool json_ = false;
};

}  // namespace tamber
