#include "cli/CommandLine.h"

#include <iostream>
#include <memory>
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
#include "cli/ThumbnailCommand.h"
#include "cli/TrashItemCommand.h"
#include "cli/WatchCommand.h"
#include "support/Log.h"
#include "support/StderrLogSink.h"

namespace tamber {

int runCommandLine(int argc, char** argv) {
    return runCommandLine(argc, argv, std::cout, std::cerr);
}

int runCommandLine(int argc, char** argv, std::ostream& out, std::ostream& err) {
    CliContext context(out, err);
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
    app.add_flag("--debug", context.debug, "Write debug log lines");
    app.add_flag("--verbose", context.verbose,
                 "Write informational log lines to standard error (only errors by default)");
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
    std::vector<std::pair<CLI::App*, Command*>> verbs;
    for (auto& c : commands) verbs.emplace_back(c->add(app), c.get());

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return app.exit(e, out, err);
    }
    Log::shared().setDebugEnabled(context.debug);
    // Without a system journal the log goes to the terminal, where a command shows only its
    // errors unless asked for more.
    if (!context.debug && !context.verbose &&
        std::dynamic_pointer_cast<StderrLogSink>(Log::shared().sink()))
        Log::shared().setSink(std::make_shared<StderrLogSink>(LogLevel::Error));
    if (auto error = context.prepareStorage()) {
        bool json = false;
        for (int i = 1; i < argc; ++i) json = json || std::string_view(argv[i]) == "--json";
        return context.fail(*error, json);
    }
    for (auto& [sub, command] : verbs) {
        if (sub->parsed())
            return command->run(context);
    }
    return 2;
}

}  // namespace tamber
