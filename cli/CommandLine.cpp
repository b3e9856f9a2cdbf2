#include "cli/CommandLine.h"

#include <iostream>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>

#include "cli/AnchorCommand.h"
#include "cli/AppsCommand.h"
#include "cli/ChangesCommand.h"
#include "cli/CliContext.h"
#include "cli/CreateItemCommand.h"
#include "cli/EventsCommand.h"
#include "cli/IdCommand.h"
#include "cli/ItemCommand.h"
#include "cli/ItemMetadataCommand.h"
#include "cli/ListCommand.h"
#include "cli/MetaCommand.h"
#include "cli/MoveItemCommand.h"
#include "cli/PathCommand.h"
#include "cli/PurgeTrashCommand.h"
#include "cli/RemoveItemCommand.h"
#include "cli/SearchCommand.h"
#include "cli/ServeCommand.h"
#include "cli/StatusCommand.h"
#include "cli/ThumbnailCommand.h"
#include "cli/TrashItemCommand.h"
#include "cli/WatchCommand.h"
#include "support/JournalLogSink.h"
#include "support/Log.h"
#include "support/StderrLogSink.h"

namespace tamber {

int runCommandLine(int argc, char** argv) {
    return runCommandLine(argc, argv, std::cout, std::cerr);
}

namespace {

// Whether the command line asks for JSON, read before (or without) a successful parse.
bool wantsJson(int argc, char** argv) {
    for (int i = 1; i < argc; ++i)
        if (std::string_view(argv[i]) == "--json")
            return true;
    return false;
}

// The positional arguments a verb was given, as typed.
std::vector<std::string> positionalArguments(const CLI::App& verb) {
    std::vector<std::string> arguments;
    for (const CLI::Option* option : verb.get_options()) {
        if (option->get_positional())
            for (const auto& value : option->results()) arguments.push_back(value);
    }
    return arguments;
}

// Log lines are for whoever looks into a problem; what failed is said once, by the verb. So by
// default they go to the system journal when there is one and nowhere otherwise (the stderr
// sink the log starts with on a machine without a journal would repeat every failure). With
// --verbose (information and errors) or --debug (everything) they go to standard error
// instead, where the person who asked reads them. A sink installed by someone else (a test's
// capture) is left alone.
void chooseLogSink(bool verbose, bool debug) {
    Log& log = Log::shared();
    auto sink = log.sink();
    bool builtIn = std::dynamic_pointer_cast<StderrLogSink>(sink) ||
                   std::dynamic_pointer_cast<JournalLogSink>(sink);
    if (!builtIn)
        return;
    if (verbose || debug)
        log.setSink(std::make_shared<StderrLogSink>(debug ? LogLevel::Debug : LogLevel::Info));
    else if (!std::dynamic_pointer_cast<JournalLogSink>(sink))
        log.setSink(nullptr);
}

// A parse error as a usage error: one line naming the verb, the option and the value.
Error usageErrorFor(const CLI::ParseError& e, CLI::App& app,
                    const std::vector<std::pair<CLI::App*, Command*>>& verbs) {
    std::string verb;
    for (const auto& [sub, command] : verbs)
        if (sub->parsed())
            verb = sub->get_name();
    std::string message = e.what();
    // Without a verb, CLI11 only says that one is required; say what was given instead.
    if (std::vector<std::string> rest = app.remaining(); verb.empty() && !rest.empty()) {
        const std::string& first = rest.front();
        message = (first.starts_with('-') ? "no such option: " : "no such verb: ") +
                  (first.empty() ? "\"\"" : first);
    }
    return CliContext::usageError((verb.empty() ? "" : verb + ": ") + message + " (see tamber " +
                                  (verb.empty() ? "" : verb + " ") + "--help)");
}

int runParsed(int argc, char** argv, CliContext& context, std::ostream& out, std::ostream& err) {
    CLI::App app{
        "tamber: publishes a device's documents to a file browser, addressed by "
        "persistent identifiers"};
    app.set_version_flag("--version", std::string("tamber ") + TAMBER_VERSION);
    app.add_option("--storage", context.storagePath,
                   "The document storage folder (default ~/Documents; created when missing)");
    app.add_option("--wait", context.waitSeconds,
                   "Seconds to wait for another Tamber process that is using the event journal "
                   "(default 10; 0 fails at once)")
        ->check(CLI::NonNegativeNumber);
    app.add_flag("--debug", context.debug,
                 "Write every log line, debug ones too, to standard error");
    app.add_flag("--verbose", context.verbose,
                 "Write information and error log lines to standard error (by default they go "
                 "to the system journal, if there is one)");
    app.add_flag("--direct", context.direct,
                 "Run the verb here even though a Tamber server may be running (fails while one "
                 "holds the event journal); by default a running server answers");
    app.require_subcommand(1);

    std::vector<std::unique_ptr<Command>> commands;
    commands.push_back(std::make_unique<MetaCommand>());
    commands.push_back(std::make_unique<IdCommand>());
    commands.push_back(std::make_unique<PathCommand>());
    commands.push_back(std::make_unique<EventsCommand>());
    commands.push_back(std::make_unique<ItemCommand>());
    commands.push_back(std::make_unique<AppsCommand>());
    commands.push_back(std::make_unique<ListCommand>());
    commands.push_back(std::make_unique<ChangesCommand>());
    commands.push_back(std::make_unique<AnchorCommand>());
    commands.push_back(std::make_unique<WatchCommand>());
    // Acting on items, as the file browser does.
    commands.push_back(std::make_unique<CreateItemCommand>(CreateItemCommand::Verb::Import));
    commands.push_back(std::make_unique<CreateItemCommand>(CreateItemCommand::Verb::Mkdir));
    commands.push_back(std::make_unique<MoveItemCommand>(MoveItemCommand::Verb::Rename));
    commands.push_back(std::make_unique<MoveItemCommand>(MoveItemCommand::Verb::Move));
    commands.push_back(std::make_unique<RemoveItemCommand>());
    commands.push_back(std::make_unique<TrashItemCommand>(TrashItemCommand::Verb::Trash));
    commands.push_back(std::make_unique<TrashItemCommand>(TrashItemCommand::Verb::Untrash));
    commands.push_back(std::make_unique<ItemMetadataCommand>(ItemMetadataCommand::Verb::Tag));
    commands.push_back(std::make_unique<ItemMetadataCommand>(ItemMetadataCommand::Verb::Rank));
    commands.push_back(std::make_unique<ItemMetadataCommand>(ItemMetadataCommand::Verb::Touch));
    commands.push_back(std::make_unique<ThumbnailCommand>());
    commands.push_back(std::make_unique<PurgeTrashCommand>());
    commands.push_back(std::make_unique<ServeCommand>());
    // Answered by a running server only.
    commands.push_back(std::make_unique<StatusCommand>());
    commands.push_back(std::make_unique<SearchCommand>());
    std::vector<std::pair<CLI::App*, Command*>> verbs;
    for (auto& c : commands) verbs.emplace_back(c->add(app), c.get());

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        // --help and --version are answers, not errors.
        if (e.get_exit_code() == static_cast<int>(CLI::ExitCodes::Success))
            return app.exit(e, out, err);
        return context.fail(usageErrorFor(e, app, verbs), wantsJson(argc, argv));
    }
    Log::shared().setDebugEnabled(context.debug);
    chooseLogSink(context.verbose, context.debug);
    for (auto& [sub, command] : verbs) {
        if (!sub->parsed())
            continue;
        context.setInvocation(sub->get_name(), positionalArguments(*sub));
        if (auto status = context.prepareStorage(); !status.ok())
            return context.fail(status.error(), wantsJson(argc, argv));
        if (auto status = context.discoverServer(); !status.ok())
            return context.fail(status.error(), wantsJson(argc, argv));
        return command->run(context);
    }
    return context.fail(CliContext::usageError("no verb given (see tamber --help)"),
                        wantsJson(argc, argv));
}

}  // namespace

int runCommandLine(int argc, char** argv, std::ostream& out, std::ostream& err) {
    CliContext context(out, err);
    // A verb fails with its own message; anything thrown on the way (a bug, an allocation that
    // failed) still ends as one line and a failure status, not an abort.
    try {
        return runParsed(argc, argv, context, out, err);
    } catch (const std::exception& e) {
        return context.fail(CliContext::internalError(e.what()), wantsJson(argc, argv));
    }
}

}  // namespace tamber
