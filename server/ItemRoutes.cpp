#include "server/ItemRoutes.h"

#include <cmath>
#include <set>
#include <string>
#include <vector>

#include "host/PublishedTrees.h"
#include "platform/Tag.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "runtime/JsonValues.h"
#include "runtime/ProviderCalls.h"
#include "server/ApiReply.h"
#include "server/ItemPatch.h"
#include "server/RouteSupport.h"

namespace tamber {

namespace {

// The absolute path a `path` query parameter names, or the refusal in `response`.
std::optional<Url> pathParameter(const httplib::Request& request, httplib::Response& response) {
    std::string path = request.get_param_value("path");
    if (path.empty() || path.front() != '/') {
        RouteSupport::replyBadRequest(response, "path must be an absolute path");
        return std::nullopt;
    }
    Url url = Url::fileURLWithPath(path);
    if (auto outside = PublishedTrees::check(url); !outside.ok()) {
        ApiReply::error(response, outside.error());
        return std::nullopt;
    }
    return url;
}

}  // namespace

void ItemRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    server.Get(R"(/api/v1/items/([^/]+))", [context](const httplib::Request& request,
                                                     httplib::Response& response) {
        auto identifier = RouteSupport::identifierFrom(request.matches[1]);
        RouteSupport::replyItem(response, context->provider->itemForIdentifier(identifier));
    });

    server.Get(R"(/api/v1/items/([^/]+)/path)",
               [context](const httplib::Request& request, httplib::Response& response) {
                   const std::string text = request.matches[1];
                   auto identifier = RouteSupport::identifierFrom(text);
                   std::optional<Url> url;
                   if (identifier == HostPorterWorkingSetContainerItemIdentifier ||
                       identifier == HostPorterRootContainerItemIdentifier) {
                       // The working set gathers items from every tree; the storage is where it
                       // starts.
                       url = context->storage;
                   } else {
                       url = context->provider->URLForItemWithPersistentIdentifier(identifier);
                   }
                   if (!url)
                       return ApiReply::error(
                           response, Error::porterErrorForNonExistentItemWithIdentifier(text));
                   nlohmann::json body{{"id", text}};
                   setTextWithBytes(body, "path", "pathBytes", url->path());
                   ApiReply::json(response, body);
               });

    server.Get("/api/v1/lookup",
               [context](const httplib::Request& request, httplib::Response& response) {
                   auto url = pathParameter(request, response);
                   if (!url)
                       return;
                   RouteSupport::replyItem(response, context->provider->itemAtURL(*url));
               });

    server.Get("/api/v1/identifiers", [context](const httplib::Request& request,
                                                httplib::Response& response) {
        auto url = pathParameter(request, response);
        if (!url)
            return;
        auto identifier = context->provider->persistentIdentifierForItemAtURL(*url);
        if (!identifier) {
            return ApiReply::error(response,
                                   Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                                         {{"description", "no identifier for " + url->path() +
                                                              " (missing, or outside the published "
                                                              "folders)"}}));
        }
        nlohmann::json body{{"identifier", *identifier}, {"id", *identifier}};
        setTextWithBytes(body, "path", "pathBytes", url->path());
        ApiReply::json(response, body);
    });

    server.Patch(R"(/api/v1/items/([^/]+))", [context](const httplib::Request& request,
                                                       httplib::Response& response,
                                                       const httplib::ContentReader& reader) {
        auto body = RouteSupport::readJsonObject(request, response, reader);
        if (!body)
            return;
        auto patch = ItemPatch::parse(*body);
        if (!patch.ok())
            return ApiReply::error(response, patch.error());
        auto identifier = RouteSupport::identifierFrom(request.matches[1]);
        RouteSupport::replyItem(response, patch.value().apply(*context->provider, identifier));
    });

    server.Delete(R"(/api/v1/items/([^/]+))",
                  [context](const httplib::Request& request, httplib::Response& response) {
                      auto identifier = RouteSupport::identifierFrom(request.matches[1]);
                      Status status = ProviderCalls::waitForStatus([&](auto done) {
                          context->provider->deleteItemWithIdentifier(identifier, std::move(done));
                      });
                      if (!status.ok())
                          return ApiReply::error(response, status.error());
                      ApiReply::json(response, {{"deleted", identifier}});
                  });
}

}  // namespace tamber
