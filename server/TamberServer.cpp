#include "server/TamberServer.h"

#include <systemd/sd-daemon.h>
#include <unistd.h>

#include "platform/imaging/PixbufThumbnailRenderer.h"
#include "platform/tremors/TremorService.h"
#include "runtime/RunFile.h"
#include "server/ContainerRoutes.h"
#include "server/ContentRoutes.h"
#include "server/DesktopThumbnails.h"
#include "server/EventRoutes.h"
#include "server/ItemRoutes.h"
#include "server/JournalRoutes.h"
#include "server/StatusRoutes.h"
#include "server/WebRoutes.h"
#include "support/Log.h"
#include "support/RandomToken.h"

namespace tamber {

std::vector<HttpServer::RouteGroup> TamberServer::routeGroups(const std::string& webRoot) {
    // Every route group of the API, added to each listening socket.
    return {
        ItemRoutes::add,
        ContainerRoutes::add,
        StatusRoutes::add,
        EventRoutes::add,
        JournalRoutes::add,
        [](httplib::Server& server, std::shared_ptr<ApiContext> context) {
            ContentRoutes::add(server, context);
            // The context outlives its routes; holding it from its own member would leak it.
            ApiContext* raw = context.get();
            context->multipartUpload = [raw](const httplib::Request& request,
                                             httplib::Response& response,
                                             const httplib::ContentReader& reader) {
                ContentRoutes::handleUpload(request, response, reader, *raw);
            };
        },
        [webRoot](httplib::Server& server, std::shared_ptr<ApiContext> context) {
            WebRoutes::add(server, std::move(context), webRoot);
        },
    };
}

TamberServer::TamberServer(TamberServerOptions options)
    : options_(std::move(options)),
      token_(options_.token.empty() ? RandomToken::hex(32) : options_.token),
      runFile_(options_.runFile.empty() ? RunFile::defaultLocation().path() : options_.runFile) {
    callbacks_->events = events_;
    context_->events = events_;
}

TamberServer::~TamberServer() {
    stop();
}

int TamberServer::port() const {
    return http_ ? http_->port() : 0;
}

std::string TamberServer::url() const {
    return "http://127.0.0.1:" + std::to_string(port()) + "/#token=" + token_;
}

Status TamberServer::start() {
    if (stopped_ || runtime_)
        return Error::posix(EALREADY);
    ProviderRuntimeOptions runtimeOptions;
    runtimeOptions.journal = ProviderRuntimeOptions::Journal::Owned;
    runtimeOptions.storagePath = options_.storagePath;
    runtimeOptions.stateDir =
        options_.stateDir.empty() ? TremorService::defaultStateDir() : options_.stateDir;
    runtimeOptions.inotify = options_.inotify;
    runtimeOptions.logSink = options_.logSink;
    std::weak_ptr<Callbacks> weak = callbacks_;
    runtimeOptions.onSignal = [weak](const HostPorterItemIdentifier& container) {
        auto callbacks = weak.lock();
        if (!callbacks)
            return;
        std::lock_guard lock(callbacks->mutex);
        if (callbacks->replica)
            callbacks->replica->signal(container);
        callbacks->events->publishSignal(container);
    };
    runtimeOptions.onDeleteIndex = [weak](const std::vector<std::string>& domains,
                                          HostPorterManager::Completion completion) {
        auto callbacks = weak.lock();
        if (callbacks) {
            std::unique_lock lock(callbacks->mutex);
            if (callbacks->replica)
                return callbacks->replica->deleteSearchableItems(domains, std::move(completion));
        }
        // Nothing is indexed without a replica: the deletion is done.
        if (completion)
            completion(std::nullopt);
    };
    runtime_ = std::make_unique<ProviderRuntime>(std::move(runtimeOptions));

    if (auto prepared = runtime_->prepareStorage(); !prepared.ok())
        return prepared;
    context_->storage = runtime_->storageURL();
    const std::string storagePath = context_->storage.path();
    if (auto running = RunFile::liveServerFor(Url::fileURLWithPath(runFile_), storagePath)) {
        return Error(kPosixErrorDomain, EBUSY,
                     {{"description", "a Tamber server is already running for " + storagePath +
                                          " (pid " + std::to_string(running->pid) + ", port " +
                                          std::to_string(running->port) + ")"}});
    }
    auto provider = runtime_->provider();
    if (!provider.ok())
        return provider.error();
    context_->provider = provider.value();
    DesktopThumbnails::Options thumbnailOptions;
    thumbnailOptions.cacheFolder = DesktopThumbnails::defaultCacheFolder();
    thumbnailOptions.renderer = std::make_shared<PixbufThumbnailRenderer>();
    context_->thumbnails = std::make_shared<DesktopThumbnails>(std::move(thumbnailOptions));
    auto journal = runtime_->startJournal();
    if (journal.ok())
        context_->journal = journal.value();

    if (options_.replicaFactory) {
        HostReplica::Options replicaOptions;
        replicaOptions.databasePath =
            (options_.stateDir.empty() ? TremorService::defaultStateDir() : options_.stateDir) +
            "/replica.db";
        replicaOptions.provider = context_->provider;
        replicaOptions.journal = context_->journal;
        auto opened = options_.replicaFactory(std::move(replicaOptions));
        if (!opened.ok())
            return opened.error();
        replica_ = std::move(opened.value());
        auto events = events_;
        replicaListener_ = replica_->subscribe(
            [events](const ReplicaBatch& batch) { events->publishBatch(batch); });
        context_->replica = replica_.get();
        std::lock_guard lock(callbacks_->mutex);
        callbacks_->replica = replica_.get();
    }

    http_ = std::make_unique<HttpServer>(context_, token_, routeGroups(options_.webRoot));
    if (auto listening = http_->start(options_.port); !listening.ok())
        return listening;

    RunFileRecord record;
    record.pid = ::getpid();
    record.port = http_->port();
    record.token = token_;
    record.storage = storagePath;
    if (auto written = RunFile::write(Url::fileURLWithPath(runFile_), record); !written.ok())
        return written;
    runFileWritten_ = true;
    logInfo("serving " + storagePath + " on 127.0.0.1:" + std::to_string(record.port));

    if (replica_)
        replica_->start();
    return Status::OK();
}

bool TamberServer::waitUntilReady(std::chrono::milliseconds timeout) {
    if (stopped_ || !http_)
        return false;
    if (replica_ && !replica_->waitUntilReady(timeout))
        return false;
    sd_notify(0, "READY=1");
    return true;
}

void TamberServer::stop() {
    if (stopped_)
        return;
    stopped_ = true;
    sd_notify(0, "STOPPING=1");
    // A followed journal stream only ends when told; the listeners wait for every request.
    JournalRoutes::stopStreams(*context_);
    if (http_)
        http_->stop();
    {
        std::lock_guard lock(callbacks_->mutex);
        callbacks_->replica = nullptr;
    }
    if (replica_) {
        replica_->unsubscribe(replicaListener_);
        replica_->shutdown();
    }
    if (runtime_)
        runtime_->shutdown();
    context_->replica = nullptr;
    if (runFileWritten_)
        RunFile::remove(Url::fileURLWithPath(runFile_), ::getpid());
}

}  // namespace tamber
