#include "tests/model/ModelHost.h"

#include <poll.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <mutex>
#include <thread>
#include <vector>

#include "host/HostPorterChangeObserver.h"
#include "host/HostPorterEnumerationObserver.h"
#include "platform/LinuxFileSystem.h"
#include "platform/tremors/TremorService.h"
#include "support/DispatchSemaphore.h"
#include "support/Error.h"
#include "tests/common/HostRecorders.h"

namespace tamber::model {

using testing::BatchRecorder;
using testing::PageRecorder;

namespace {

// Only a hang gets near it.
constexpr double kPatience = 60;

}  // namespace

int OverflowingInotify::init(int flags) {
    int fd = real_->init(flags);
    std::lock_guard lock(mutex_);
    unread_.clear();  // what was left belonged to the descriptor of the last start
    inotifyFd_ = fd;
    return fd;
}

int OverflowingInotify::poll(struct pollfd* fds, nfds_t count, int timeoutMs) {
    if (hold) {
        // Nothing is ready while held; the reader comes back after its timeout.
        std::this_thread::sleep_for(
            std::chrono::milliseconds(timeoutMs < 0 ? 5 : std::min(timeoutMs, 5)));
        for (nfds_t i = 0; i < count; ++i) fds[i].revents = 0;
        return 0;
    }
    bool unread;
    {
        std::lock_guard lock(mutex_);
        unread = !unread_.empty();
    }
    if (!unread)
        return real_->poll(fds, count, timeoutMs);
    // Events read but not handed out make the queue readable now.
    int ready = real_->poll(fds, count, 0);
    if (ready < 0)
        return ready;
    for (nfds_t i = 0; i < count; ++i) {
        if (fds[i].fd == inotifyFd_ && !(fds[i].revents & POLLIN)) {
            fds[i].revents |= POLLIN;
            ++ready;
        }
    }
    return ready;
}

int OverflowingInotify::queuedBytes(int fd) {
    int queued = real_->queuedBytes(fd);
    std::lock_guard lock(mutex_);
    return queued < 0 ? queued : queued + int(unread_.size());
}

ssize_t OverflowingInotify::read(int fd, void* buffer, size_t size) {
    if (hold) {
        errno = EAGAIN;
        return -1;
    }
    std::lock_guard lock(mutex_);
    if (size >= sizeof(inotify_event) && overflowNext.exchange(false)) {
        unread_.clear();
        std::vector<char> dropped(1 << 16);
        while (real_->queuedBytes(fd) > 0 && real_->read(fd, dropped.data(), dropped.size()) > 0) {
        }
        inotify_event overflow{};
        overflow.wd = -1;
        overflow.mask = IN_Q_OVERFLOW;
        std::memcpy(buffer, &overflow, sizeof overflow);
        return sizeof overflow;
    }
    if (!trickle && unread_.empty())
        return real_->read(fd, buffer, size);
    if (unread_.empty()) {
        unread_.resize(1 << 16);
        ssize_t n = real_->read(fd, unread_.data(), unread_.size());
        unread_.resize(size_t(std::max<ssize_t>(n, 0)));
        if (n <= 0)
            return n;
    }
    inotify_event head;
    std::memcpy(&head, unread_.data(), sizeof head);
    const size_t length = sizeof(inotify_event) + head.len;
    if (size < length) {
        errno = EINVAL;  // as the kernel answers a buffer too small for the next event
        return -1;
    }
    std::memcpy(buffer, unread_.data(), length);
    unread_.erase(unread_.begin(), unread_.begin() + long(length));
    return ssize_t(length);
}

ModelHost::ModelHost(std::string storage, std::string state)
    : storage_(std::move(storage)),
      state_(std::move(state)),
      faults_(std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>())) {}

ModelHost::~ModelHost() {
    stop();
}

std::string ModelHost::start() {
    if (runtime_)
        return "";
    ProviderRuntimeOptions options;
    options.storagePath = storage_;
    options.stateDir = state_;
    options.inotify = inotify_;
    options.fileSystem = faults_;
    runtime_ = std::make_unique<ProviderRuntime>(options);
    auto journal = runtime_->startJournal();
    if (!journal.ok())
        return "the journal did not start: " + journal.error().description();
    journal_ = journal.value();
    auto porter = runtime_->provider();
    if (!porter.ok())
        return "the provider did not start: " + porter.error().description();
    porter_ = porter.value();
    enumerator_ = nullptr;
    return "";
}

void ModelHost::stop(bool midEnumeration) {
    if (!runtime_)
        return;
    if (midEnumeration && anchor_) {
        if (auto enumerator = workingSet())
            enumerator->enumerateChangesForObserver(std::make_shared<BatchRecorder>(), *anchor_);
    }
    if (enumerator_)
        enumerator_->invalidate();
    enumerator_ = nullptr;
    porter_ = nullptr;
    journal_ = nullptr;
    runtime_->shutdown();
    runtime_ = nullptr;
}

void ModelHost::sync() {
    if (journal_)
        journal_->sync();
}

HostPorterEnumeratorRef ModelHost::workingSet() {
    if (!enumerator_ && porter_) {
        auto made = porter_->enumeratorForContainerItemIdentifier(
            HostPorterWorkingSetContainerItemIdentifier);
        if (made.ok())
            enumerator_ = made.value();
    }
    return enumerator_;
}

std::string ModelHost::relist() {
    auto enumerator = workingSet();
    if (!enumerator)
        return "no working-set enumerator";
    ++relists_;
    // The anchor comes first, so that what changes during the listing is asked for again.
    std::optional<HostPorterSyncAnchor> anchor;
    DispatchSemaphore got;
    enumerator->currentSyncAnchorWithCompletionHandler([&](auto value) {
        anchor = value;
        got.signal();
    });
    if (!got.wait(kPatience) || !anchor)
        return "no current sync anchor";
    Replica fresh;
    HostPorterPage page = HostPorterInitialPageSortedByName();
    for (int pages = 0;; ++pages) {
        if (pages > 10000)
            return "the listing never ended";
        auto recorder = std::make_shared<PageRecorder>();
        enumerator->enumerateItemsForObserver(recorder, page);
        if (!recorder->done.wait(kPatience))
            return "a listing page never finished";
        if (recorder->error)
            return "listing failed: " + recorder->error->description();
        for (const auto& item : recorder->items)
            fresh[item->itemIdentifier()] = {item->filename(), item->parentItemIdentifier()};
        if (!recorder->next)
            break;
        page = *recorder->next;
    }
    replica_ = std::move(fresh);
    anchor_ = anchor;
    return "";
}

std::string ModelHost::catchUp() {
    if (!anchor_) {
        std::string failed = relist();
        if (!failed.empty())
            return failed;
    }
    auto enumerator = workingSet();
    if (!enumerator)
        return "no working-set enumerator";
    for (int requests = 0; requests < 1000; ++requests) {
        auto recorder = std::make_shared<BatchRecorder>();
        enumerator->enumerateChangesForObserver(recorder, *anchor_);
        if (!recorder->done.wait(kPatience))
            return "a change enumeration never finished";
        std::lock_guard lock(recorder->mutex);
        if (recorder->error) {
            if (recorder->error->domain() == kHostPorterErrorDomain &&
                recorder->error->code() == kHostPorterSyncAnchorExpired) {
                anchor_.reset();
                std::string failed = relist();
                if (!failed.empty())
                    return failed;
                continue;
            }
            return "changes failed: " + recorder->error->description();
        }
        for (const auto& [item, deleted] : recorder->changes) {
            if (item)
                replica_[item->itemIdentifier()] = {item->filename(), item->parentItemIdentifier()};
            else
                replica_.erase(deleted);
        }
        anchor_ = recorder->anchor;
        if (!recorder->moreComing)
            return "";
    }
    return "changes never caught up";
}

}  // namespace tamber::model
