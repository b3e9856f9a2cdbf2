#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "host/HostPorterEnumerator.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/tremors/InotifyApi.h"
#include "provider/LocalPorter.h"
#include "runtime/ProviderRuntime.h"

namespace tamber::model {

// The system's inotify calls, except that reading can be held back while changes are made,
// and the next read can be made to overflow: what the kernel queued is dropped and a queue
// overflow reported instead, as when the kernel loses events. With `trickle`, each read hands
// out one event, as a reader that keeps up with a slow writer sees them: every place where a
// burst of events can be split between two reads is then split.
class OverflowingInotify : public InotifyApi {
public:
    std::atomic<bool> overflowNext{false};
    std::atomic<bool> hold{false};
    std::atomic<bool> trickle{false};

    int init(int flags) override;
    int addWatch(int fd, const std::string& path, uint32_t mask) override {
        return real_->addWatch(fd, path, mask);
    }
    int removeWatch(int fd, int wd) override { return real_->removeWatch(fd, wd); }
    ssize_t read(int fd, void* buffer, size_t size) override;
    int queuedBytes(int fd) override;
    int eventfd(unsigned int initial, int flags) override { return real_->eventfd(initial, flags); }
    int signal(int eventFd) override { return real_->signal(eventFd); }
    int poll(struct pollfd* fds, nfds_t count, int timeoutMs) override;
    int close(int fd) override { return real_->close(fd); }

private:
    std::shared_ptr<InotifyApi> real_ = InotifyApi::system();
    std::atomic<int> inotifyFd_{-1};
    std::mutex mutex_;
    std::vector<char> unread_;  // read from the kernel, not yet handed out (trickle)
};

// What a browser keeps of the working set: each item's name and parent, by identifier.
struct ReplicaEntry {
    std::string filename;
    HostPorterItemIdentifier parent;
    friend bool operator==(const ReplicaEntry&, const ReplicaEntry&) = default;
};
using Replica = std::map<HostPorterItemIdentifier, ReplicaEntry>;

// A host over the model test's storage: a runtime with its own journal (restartable), a file
// system that can be made to fail, inotify that can be made to overflow, and a replica of the
// working set built from one listing and then only from change enumerations, applied in the
// order sent; an expired anchor makes it list again, as a host must.
class ModelHost {
public:
    // `storage` is the document storage folder, `state` the journal's folder.
    ModelHost(std::string storage, std::string state);
    ~ModelHost();

    // Starts a runtime and its provider. An empty string on success, else what failed.
    std::string start();
    // Shuts the runtime down. With `midEnumeration`, a change enumeration is asked for first
    // and left running, as a host stopped at any moment would.
    void stop(bool midEnumeration = false);
    bool running() const { return runtime_ != nullptr; }

    LocalPorter& porter() { return *porter_; }
    FaultInjectingFileSystem& faults() { return *faults_; }
    OverflowingInotify& inotify() { return *inotify_; }

    // Waits until the journal holds every change made before the call.
    void sync();
    // Lists the whole working set afresh.
    std::string relist();
    // Asks for changes until caught up; an expired anchor relists. Empty on success.
    std::string catchUp();
    const Replica& replica() const { return replica_; }
    // How often the host had to list again since it started.
    int relists() const { return relists_; }

private:
    HostPorterEnumeratorRef workingSet();

    const std::string storage_;
    const std::string state_;
    std::shared_ptr<FaultInjectingFileSystem> faults_;
    std::shared_ptr<OverflowingInotify> inotify_ = std::make_shared<OverflowingInotify>();
    std::unique_ptr<ProviderRuntime> runtime_;
    std::shared_ptr<LocalPorter> porter_;
    std::shared_ptr<TremorService> journal_;
    HostPorterEnumeratorRef enumerator_;

    Replica replica_;
    std::optional<HostPorterSyncAnchor> anchor_;  // none: list first
    int relists_ = 0;
};

}  // namespace tamber::model
