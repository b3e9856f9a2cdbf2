#include "cli/SearchCommand.h"

#include <cerrno>
#include <ostream>

#include "cli/RemoteItem.h"
#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "cli/TextEscape.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* SearchCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "search", "Search the items the running Tamber server knows (start it with tamber serve)");
    sub->add_option("QUERY", query_, "Text the name contains (any case)");
    sub->add_option("--tag", tag_, "Only items with this tag");
    sub->add_option("--type", type_, "Only items of this type or a subtype (public.image)");
    sub->add_flag("--favorites", favorites_, "Only items with a favourite rank");
    sub->add_flag("--recent", recent_, "Only items used before, most recently used first");
    sub->add_flag("--trashed", trashed_, "Only trashed items");
    sub->add_option("--limit", limit_, "At most this many items")->check(CLI::PositiveNumber);
    sub->add_flag("--json", json_, R"(Print {"items": [...]})");
    return sub;
}

std::string SearchCommand::requestPath() const {
    std::string path = "search?q=" + ServerClient::encode(query_);
    if (!tag_.empty())
        path += "&tag=" + ServerClient::encode(tag_);
    if (!type_.empty())
        path += "&type=" + ServerClient::encode(type_);
    if (favorites_)
        path += "&favorite=true";
    if (recent_)
        path += "&recent=true";
    if (trashed_)
        path += "&trashed=true";
    if (limit_ > 0)
        path += "&limit=" + std::to_string(limit_);
    return path;
}

int SearchCommand::run(CliContext& context) {
    if (!context.server()) {
        return context.fail(Error(kPosixErrorDomain, ENOTCONN,
                                  {{"description",
                                    "no Tamber server is running for this storage folder, and "
                                    "the search index is the server's: start it with tamber "
                                    "serve"}}),
                            json_);
    }
    auto remote = context.remoteProvider();
    if (!remote.ok())
        return context.fail(remote.error(), json_);
    auto answer = remote.value()->client().get(requestPath());
    if (!answer.ok())
        return context.fail(answer.error(), json_);
    const nlohmann::json& body = answer.value();
    if (!body.is_object() || !body.contains("items") || !body["items"].is_array())
        return context.fail(
            Error(kPosixErrorDomain, EPROTO,
                  {{"description", "the Tamber server sent malformed search results"}}),
            json_);
    if (json_) {
        context.out() << jsonText(nlohmann::json{{"items", body["items"]}}) << "\n";
        return 0;
    }
    for (const auto& record : body["items"]) {
        auto item = RemoteItem::fromJson(record);
        if (!item.ok())
            return context.fail(item.error(), json_);
        context.out() << escapedText(item.value()->itemIdentifier()) << "\t"
                      << escapedText(item.value()->filename()) << "\t"
                      << item.value()->typeIdentifier() << "\n";
    }
    return 0;
}

}  // namespace tamber
