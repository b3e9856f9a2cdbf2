#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/Url.h"
#include "platform/tremors/InotifyApi.h"
#include "runtime/ProviderRuntime.h"
#include "server/ApiContext.h"
#include "server/EventHub.h"
#include "server/HostReplica.h"
#include "server/HttpServer.h"
#include "support/LogSink.h"
#include "support/Result.h"

namespace tamber {

struct TamberServerOptions {
    std::string storagePath;  // empty: ~/Documents
    std::string stateDir;     // the journal's and the replica's state; empty: the default
    int port = 8177;          // 0: any free port
    std::string runFile;      // empty: RunFile::defaultLocation()
    std::string token;        // empty: a new random one
    std::string webRoot;      // the web page's files from this folder; empty: the embedded ones
    // Makes the replica; empty: the server runs without one (no search, no change events).
    using ReplicaFactory =
        std::function<Result<std::unique_ptr<HostReplica>>(HostReplica::Options options)>;
    ReplicaFactory replicaFactory;
    std::shared_ptr<InotifyApi> inotify;  // null: the system's
    std::shared_ptr<LogSink> logSink;     // null: the process's
};

// `tamber serve`: one process per document storage folder, playing the host. It runs the
// provider with a journal of its own (live for the whole run), keeps the host's replica caught
// up on the provider's signals, answers the HTTP API and tells its clients where it is through
// the run file.
//
// start(): storage prepared; refused when a live server already serves it (the error names its
// process); provider started (refused when another process holds the journal); replica opened;
// HTTP listening; run file written; first catch-up started.
// stop(), in order: no new requests, event streams ended, requests in flight finished; replica
// stopped; runtime shut down (what the journal read is journaled); run file removed.
class TamberServer {
public:
    explicit TamberServer(TamberServerOptions options);
    ~TamberServer();
    TamberServer(const TamberServer&) = delete;
    TamberServer& operator=(const TamberServer&) = delete;

    // The route groups every server answers, in the order they are added; `webRoot` as in
    // TamberServerOptions.
    static std::vector<HttpServer::RouteGroup> routeGroups(const std::string& webRoot = {});

    Status start();
    int port() const;
    const std::string& token() const { return token_; }
    // "http://127.0.0.1:PORT/#token=TOKEN": the fragment never reaches a server.
    std::string url() const;
    const Url& storage() const { return context_->storage; }
    HostReplica* replica() { return replica_.get(); }

    // Waits until the replica's first catch-up is done (at once without a replica) and tells
    // the service manager the server is ready. False when `timeout` passed first or the server
    // stopped.
    bool waitUntilReady(std::chrono::milliseconds timeout);

    void stop();

private:
    TamberServerOptions options_;
    std::string token_;
    std::string runFile_;
    std::shared_ptr<EventHub> events_ = std::make_shared<EventHub>();
    std::shared_ptr<ApiContext> context_ = std::make_shared<ApiContext>();
    std::unique_ptr<ProviderRuntime> runtime_;
    std::unique_ptr<HostReplica> replica_;
    uint64_t replicaListener_ = 0;
    std::unique_ptr<HttpServer> http_;
    bool runFileWritten_ = false;
    bool stopped_ = false;

    // The provider's callbacks (signals, index deletions) reach the replica through this, which
    // stop() empties: they may come on any thread, also while the server stops.
    struct Callbacks {
        std::mutex mutex;
        HostReplica* replica = nullptr;  // guarded by mutex
        std::shared_ptr<EventHub> events;
    };
    std::shared_ptr<Callbacks> callbacks_ = std::make_shared<Callbacks>();
};

}  // namespace tamber
