#include "cli/StatusCommand.h"

#include <cerrno>
#include <ostream>

#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* StatusCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("status", "Say what the running Tamber server is doing");
    sub->add_flag("--json", json_,
                  R"(Print {"state", "items", "journalLag", "lastEventTime", "historyLost", ...})");
    return sub;
}

int StatusCommand::run(CliContext& context) {
    if (!context.server()) {
        Error none(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile,
                   {{"description", "no server running"}});
        if (json_)
            context.out() << jsonText(HostJson::error(none)) << "\n";
        else
            context.err() << "tamber: no server running\n";
        return CliContext::kExitNotFound;
    }
    auto remote = context.remoteProvider();
    if (!remote.ok())
        return context.fail(remote.error(), json_);
    auto answer = remote.value()->client().get("status");
    if (!answer.ok())
        return context.fail(answer.error(), json_);
    const nlohmann::json& status = answer.value();
    if (json_) {
        context.out() << jsonText(status) << "\n";
        return 0;
    }
    // The keys a person looks for first, then whatever else the server says.
    static const char* const kFirst[] = {"state",       "items",    "journalLag", "lastEventTime",
                                         "historyLost", "sequence", "pid",        "storage"};
    auto print = [&](const std::string& key, const nlohmann::json& value) {
        context.out() << key << ": "
                      << (value.is_string() ? value.get<std::string>()
                          : value.is_null() ? std::string("-")
                                            : jsonText(value))
                      << "\n";
    };
    if (!status.is_object())
        return context.fail(Error(kPosixErrorDomain, EPROTO,
                                  {{"description", "the Tamber server sent a malformed status"}}),
                            json_);
    for (const char* key : kFirst)
        if (status.contains(key))
            print(key, status[key]);
    for (const auto& [key, value] : status.items()) {
        bool shown = false;
        for (const char* first : kFirst) shown = shown || key == first;
        if (!shown)
            print(key, value);
    }
    return 0;
}

}  // namespace tamber
