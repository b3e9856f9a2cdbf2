#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "host/HostPorterItem.h"
#include "host/HostPorterManager.h"
#include "platform/Url.h"
#include "platform/tremors/InotifyApi.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorter.h"
#include "support/LogSink.h"
#include "support/Result.h"

namespace tamber {

class AppLibraryLookup;
class FileSystem;

// What a host hands a runtime. Empty or null members leave the process's current choice.
struct ProviderRuntimeOptions {
    // Which event journal the runtime uses.
    enum class Journal {
        // It starts one of its own on `stateDir` and stops it at shutdown (a server, a test).
        Owned,
        // It uses the process's journal (TremorService::shared(), started on first use with
        // TremorService::configure's settings) and leaves it running: a command-line run, whose
        // process stops the journal once at exit with shutdownProcess().
        ProcessWide,
    };
    Journal journal = Journal::Owned;

    std::string storagePath;  // the document storage folder; empty: $HOME/Documents
    std::string stateDir;     // an owned journal's state; empty: TremorService::defaultStateDir()
    std::shared_ptr<InotifyApi> inotify;  // an owned journal's inotify calls; null: the system's
    // How long to wait for another process that holds the journal, and whom to tell once when
    // the wait begins (the holder's process ID, 0 when unknown, and the state folder).
    double lockWaitSeconds = 0;
    std::function<void(pid_t holder, const std::string& directory)> onLockWait;

    std::shared_ptr<FileSystem> fileSystem;  // installed as FileSystem::current() while running
    std::shared_ptr<LogSink> logSink;        // installed as the log's sink while running

    // Receives the container signals the provider sends to the host, on any thread.
    std::function<void(const HostPorterItemIdentifier&)> onSignal;
    // Deletes the search index entries of app libraries the provider no longer publishes and
    // calls the completion once that is committed; the provider's app-library upgrade waits for
    // it. Empty: nothing is indexed, the deletion completes at once.
    StorageHostPorterManager::IndexDeletionHandler onDeleteIndex;
};

// The one object a host creates to run the provider: it owns the file system, the event
// journal and its document-ID service, the app-library lookup, the host manager and the log
// sink for as long as it lives, and stops them in order at shutdown. The program's lower
// layers still reach these through process-wide slots; the runtime installs its objects into
// them when it starts and takes them out at shutdown, so that a process (a test) can run one
// runtime after another. One runtime at a time per process.
//
// Start-up, in the order a host asks for it: prepareStorage() (storage folder and host
// manager), startJournal() / prepareJournal() (the journal, then the storage folder watched),
// provider() (app libraries looked up and refreshed, every published tree watched, import
// copies of killed runs swept).
//
// shutdown(), in this order:
//   1. no more signals reach the host; the provider is released;
//   2. the trees the journal remembers but this run did not publish are marked unwatched;
//   3. delayed queue work is dropped and the timer thread joined; the queues are drained and
//      every worker thread joined, while the journal still answers their blocks;
//   4. an owned journal stops: what it read is journaled, its two threads are joined;
//   5. the queue work its last batch caused is drained and the threads joined again;
//   6. the slots get back what they held before (journal, document IDs, app-library lookup,
//      host manager, log sink, file system);
//   7. the runtime's last reference to an owned journal goes, which closes its databases.
// It is harmless to call twice; the destructor calls it. Later calls of the start-up methods
// fail with ECANCELED.
class ProviderRuntime {
public:
    explicit ProviderRuntime(ProviderRuntimeOptions options);
    ~ProviderRuntime();
    ProviderRuntime(const ProviderRuntime&) = delete;
    ProviderRuntime& operator=(const ProviderRuntime&) = delete;

    // Resolves and creates the document storage folder and installs the host manager for it.
    // Fails when the folder cannot be created. Later calls change nothing.
    Status prepareStorage();
    const Url& storageURL() const { return storage_; }
    // Starts the event journal, watching nothing yet. Fails when its state cannot be opened,
    // for example because another process holds it past the wait; the error names the holder.
    Result<std::shared_ptr<TremorService>> startJournal();
    // Starts the journal and watches the storage folder, so that identifiers can be given and
    // resolved.
    Status prepareJournal();
    // Prepares storage and journal, refreshes the app libraries from the installed
    // applications, watches every published tree and hands back the provider. Later calls
    // return the same provider. What this run publishes is then known: at shutdown the trees
    // the journal remembers but this run did not watch are marked unwatched.
    Result<std::shared_ptr<LocalPorter>> provider();
    const LocalPorter::AppRefreshOutcome& appRefreshOutcome() const { return refreshOutcome_; }
    // Publishes the app libraries as last found (the main cache), without asking the registry
    // and without starting the provider, so that a host can tell published trees from others.
    // Keeps an app-library lookup already current. Fails with ECANCELED after shutdown.
    Status publishFromCache();

    // Replaces the handler of the container signals (empty: they are dropped).
    void setSignalHandler(std::function<void(const HostPorterItemIdentifier&)> handler);

    void shutdown();

    // Stops what the process keeps for its runtimes (the process-wide journal, the timer, the
    // worker threads) once no runtime is left: called by a process before it exits.
    static void shutdownProcess();

private:
    static void drainThreads();

    ProviderRuntimeOptions options_;
    // Serialises start-up and shutdown; guards every member below. Recursive: provider()
    // prepares the journal, which starts it.
    std::recursive_mutex mutex_;
    bool stopped_ = false;
    Url storage_;
    bool storagePrepared_ = false;
    std::shared_ptr<TremorService> journal_;
    bool ownsJournal_ = false;
    std::shared_ptr<LocalPorter> porter_;
    LocalPorter::AppRefreshOutcome refreshOutcome_;
    bool publishing_ = false;  // the run's publication is known

    std::shared_ptr<HostPorterManager> manager_;  // made by prepareStorage()

    // What the runtime replaced in the process-wide slots, given back at shutdown.
    bool installedManager_ = false;
    std::shared_ptr<HostPorterManager> previousManager_;
    bool installedLookup_ = false;
    std::shared_ptr<AppLibraryLookup> previousLookup_;
    std::shared_ptr<LogSink> previousSink_;
    std::shared_ptr<FileSystem> previousFileSystem_;

    // Signals may arrive on any thread after the runtime is gone: they reach the host's
    // handler through this, which shutdown empties.
    struct SignalSlot {
        std::mutex mutex;
        std::function<void(const HostPorterItemIdentifier&)> handler;  // guarded by mutex
    };
    std::shared_ptr<SignalSlot> signals_ = std::make_shared<SignalSlot>();
};

}  // namespace tamber
