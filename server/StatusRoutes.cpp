#include "server/StatusRoutes.h"

#include <unistd.h>

#include <charconv>

#include "platform/objects/Date.h"
#include "runtime/JsonValues.h"
#include "server/ApiReply.h"
#include "server/HostReplica.h"
#include "server/RouteSupport.h"

namespace tamber {

namespace {

// A yes/no query parameter: absent is `fallback`; 1/true/yes and 0/false/no.
std::optional<bool> flag(const httplib::Request& request, const char* name, bool& bad) {
    if (!request.has_param(name))
        return std::nullopt;
    const std::string value = request.get_param_value(name);
    if (value == "1" || value == "true" || value == "yes" || value.empty())
        return true;
    if (value == "0" || value == "false" || value == "no")
        return false;
    bad = true;
    return std::nullopt;
}

}  // namespace

void StatusRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    server.Get("/api/v1/status", [context](const httplib::Request&, httplib::Response& response) {
        ReplicaStatus status;
        if (context->replica)
            status = context->replica->status();
        else
            status.ready = true;  // without a replica there is nothing to catch up
        nlohmann::json body{
            {"state", status.ready && !status.catchingUp ? "ready" : "catching-up"},
            {"items", status.items},
            {"journalLag", status.journalLagEvents},
            {"lastEventTime",
             status.lastEventTime ? dateJson(Date::make(*status.lastEventTime)) : nullptr},
            {"historyLost", status.historyLost},
            {"sequence", status.sequence},
            {"pid", static_cast<int64_t>(::getpid())},
        };
        setTextWithBytes(body, "storage", "storageBytes", context->storage.path());
        ApiReply::json(response, body);
    });

    server.Get("/api/v1/search", [context](const httplib::Request& request,
                                           httplib::Response& response) {
        ReplicaSearchQuery query;
        query.text = request.get_param_value("q");
        if (request.has_param("tag"))
            query.tag = request.get_param_value("tag");
        if (request.has_param("type") && !request.get_param_value("type").empty())
            query.type = request.get_param_value("type");
        bool bad = false;
        query.favorites = flag(request, "favorite", bad).value_or(false);
        query.recent = flag(request, "recent", bad).value_or(false);
        query.trashed = flag(request, "trashed", bad);
        if (bad)
            return RouteSupport::replyBadRequest(response,
                                                 "favorite, recent and trashed take true or false");
        if (request.has_param("limit")) {
            const std::string text = request.get_param_value("limit");
            size_t limit = 0;
            auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), limit);
            if (ec != std::errc() || end != text.data() + text.size() || limit == 0 ||
                limit > kMaxSearchLimit)
                return RouteSupport::replyBadRequest(
                    response, "limit takes a number from 1 to " + std::to_string(kMaxSearchLimit));
            query.limit = limit;
        }
        if (!context->replica)
            return ApiReply::error(response,
                                   Error(kPosixErrorDomain, ENOTSUP,
                                         {{"description", "search needs the server's replica"}}));
        auto found = context->replica->search(query);
        if (!found.ok())
            return ApiReply::error(response, found.error());
        nlohmann::json items = nlohmann::json::array();
        for (auto& item : found.value()) items.push_back(std::move(item));
        ApiReply::json(response, {{"items", items}});
    });
}

}  // namespace tamber
