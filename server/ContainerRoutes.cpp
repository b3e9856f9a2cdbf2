#include "server/ContainerRoutes.h"
#include "runtime/Duration.h"

#include <chrono>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterPage.h"
#include "items/LocalAppLibraryItem.h"
#include "platform/objects/Date.h"
#include "runtime/Base64.h"
#include "runtime/ChangeCollector.h"
#include "runtime/HostJson.h"
#include "runtime/PageCollector.h"
#include "runtime/ProviderCalls.h"
#include "server/ApiReply.h"
#include "server/RouteSupport.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

namespace {

// A batch of changes is replayed from the journal; only a journal that stopped answering
// takes this long.
constexpr double kChangesPatienceSeconds = 120;

// The enumerator of the container in the path, or the error in `response`; invalidated when it
// goes.
struct Enumerator {
    HostPorterEnumeratorRef enumerator;
    ~Enumerator() {
        if (enumerator)
            enumerator->invalidate();
    }
};

bool openEnumerator(ApiContext& context, const httplib::Request& request,
                    httplib::Response& response, Enumerator& out) {
    auto identifier = RouteSupport::identifierFrom(request.matches[1]);
    auto made = context.provider->enumeratorForContainerItemIdentifier(identifier);
    if (!made.ok()) {
        ApiReply::error(response, made.error());
        return false;
    }
    out.enumerator = made.value();
    return true;
}

void createChild(ApiContext& context, const httplib::Request& request, httplib::Response& response,
                 const httplib::ContentReader& reader) {
    if (request.is_multipart_form_data()) {
        if (!context.multipartUpload)
            return RouteSupport::replyBadRequest(response, "uploads are not taken here");
        return context.multipartUpload(request, response, reader);
    }
    auto body = RouteSupport::readJsonObject(request, response, reader);
    if (!body)
        return;
    auto parent = RouteSupport::identifierFrom(request.matches[1]);
    const bool folder = body->contains("folder");
    const bool import = body->contains("import");
    if (folder == import)
        return RouteSupport::replyBadRequest(response, "give either folder or import");
    if (folder) {
        const auto& name = (*body)["folder"];
        const auto bounce = body->value("bounce", nlohmann::json(false));
        if (!name.is_string() || !bounce.is_boolean())
            return RouteSupport::replyBadRequest(response,
                                                 "folder must be a name and bounce true or false");
        return RouteSupport::replyItem(response, ProviderCalls::waitForItem([&](auto done) {
                                           context.provider->createDirectoryWithName(
                                               name.get<std::string>(), parent, bounce.get<bool>(),
                                               std::move(done));
                                       }));
    }
    const auto& source = (*body)["import"];
    if (!source.is_string() || source.get<std::string>().empty() ||
        source.get<std::string>().front() != '/')
        return RouteSupport::replyBadRequest(response, "import must be an absolute path");
    RouteSupport::replyItem(response, ProviderCalls::waitForItem([&](auto done) {
                                context.provider->importDocumentAtURL(
                                    Url::fileURLWithPath(source.get<std::string>()), parent,
                                    std::move(done));
                            }));
}

}  // namespace

void ContainerRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    server.Get(R"(/api/v1/containers/([^/]+)/children)", [context](const httplib::Request& request,
                                                                   httplib::Response& response) {
        HostPorterPage page = HostPorterInitialPageSortedByName();
        if (request.has_param("page") && !request.get_param_value("page").empty()) {
            auto decoded = RouteSupport::base64Parameter(request.get_param_value("page"));
            if (!decoded)
                return RouteSupport::replyBadRequest(response, "page is not base64");
            page = *decoded;
        }
        Enumerator opened;
        if (!openEnumerator(*context, request, response, opened))
            return;
        auto collector = std::make_shared<PageCollector>();
        opened.enumerator->enumerateItemsForObserver(collector, page);
        PageCollector::Page listed = collector->wait();
        if (listed.error)
            return ApiReply::error(response, *listed.error);
        std::vector<HostPorterItemRef> items;
        for (auto& item : listed.items)
            if (item)
                items.push_back(std::move(item));
        ApiReply::json(response, HostJson::page(items, listed.nextPage));
    });

    server.Post(R"(/api/v1/containers/([^/]+)/children)",
                [context](const httplib::Request& request, httplib::Response& response,
                          const httplib::ContentReader& reader) {
                    createChild(*context, request, response, reader);
                });

    server.Get(R"(/api/v1/containers/([^/]+)/anchor)", [context](const httplib::Request& request,
                                                                 httplib::Response& response) {
        Enumerator opened;
        if (!openEnumerator(*context, request, response, opened))
            return;
        std::optional<HostPorterSyncAnchor> anchor;
        DispatchSemaphore done;
        opened.enumerator->currentSyncAnchorWithCompletionHandler(
            [&](std::optional<HostPorterSyncAnchor> value) {
                anchor = std::move(value);
                done.signal();
            });
        done.wait();
        if (!anchor)
            return ApiReply::error(response, Error(kPosixErrorDomain, EIO,
                                                   {{"description",
                                                     "no sync anchor: the container's volume "
                                                     "has no event journal"}}));
        ApiReply::json(response, {{"anchor", base64Encode(*anchor)}});
    });

    server.Get(R"(/api/v1/containers/([^/]+)/changes)", [context](const httplib::Request& request,
                                                                  httplib::Response& response) {
        auto anchor = RouteSupport::base64Parameter(request.get_param_value("anchor"));
        if (!request.has_param("anchor") || !anchor)
            return RouteSupport::replyBadRequest(response, "anchor must be given, in base64");
        Enumerator opened;
        if (!openEnumerator(*context, request, response, opened))
            return;
        auto collector = std::make_shared<ChangeCollector>();
        opened.enumerator->enumerateChangesForObserver(collector, *anchor);
        auto batch = collector->waitFor(kChangesPatienceSeconds);
        if (!batch)
            return ApiReply::error(response, Error(kPosixErrorDomain, ETIMEDOUT,
                                                   {{"description", "the changes did not come"}}));
        if (batch->error)
            return ApiReply::error(response, *batch->error);
        ApiReply::json(response, HostJson::changeBatch(*batch));
    });

    server.Get("/api/v1/apps", [](const httplib::Request&, httplib::Response& response) {
        ApiReply::json(response, HostJson::appLibraries());
    });

    server.Post(
        "/api/v1/apps/refresh", [context](const httplib::Request&, httplib::Response& response) {
            const auto before = HostJson::appLibraries()["versionToken"];
            ProviderCalls::waitFor([&](auto done) {
                context->provider->refreshInstalledAppsWithCompletionHandler(std::move(done));
            });
            // The command line says whether the refresh changed the list.
            auto answer = HostJson::appLibraries();
            answer["rootChanged"] = answer["versionToken"] != before;
            ApiReply::json(response, answer);
        });

    server.Post("/api/v1/trash/purge", [context](const httplib::Request& request,
                                                 httplib::Response& response) {
        auto seconds = Duration::parse(request.get_param_value("olderThan"));
        if (!seconds)
            return RouteSupport::replyBadRequest(
                response, "olderThan takes a duration such as 30d, 12h, 90m or 45s");
        auto reference = Date::make(Date::now()->timeIntervalSince1970() - *seconds);
        size_t removed = ProviderCalls::waitForCount([&](auto done) {
            context->provider->removeTrashedItemsOlderThanDate(reference, std::move(done));
        });
        ApiReply::json(response, {{"removed", removed}});
    });
}

}  // namespace tamber
