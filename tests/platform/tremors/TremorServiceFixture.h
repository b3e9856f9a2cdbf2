#pragma once

// The journal service under test: a service on a temporary state folder watching one tree, and
// streams opened from the process's shared service, with the helpers their tests share.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/FileSystem.h"
#include "platform/objects/Array.h"
#include "platform/objects/String.h"
#include "platform/strata/StrataService.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"
#include "platform/tremors/TremorStoreDirectory.h"
#include "platform/tremors/Tremors.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

// Polls `condition` until it holds or ten seconds pass.
inline bool eventually(const std::function<bool()>& condition) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return condition();
}

inline struct statx statPath(const std::string& path) {
    struct statx st {};
    EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW,
                                          STATX_INO | STATX_TYPE, &st),
              0)
        << path;
    return st;
}
inline uint64_t inodeOf(const std::string& path) {
    return statPath(path).stx_ino;
}
inline uint32_t deviceOf(const std::string& path) {
    auto st = statPath(path);
    return encodeDevice(st.stx_dev_major, st.stx_dev_minor);
}

inline void writeText(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}
// Writes a temporary file next to `path` and renames it over `path`, as editors save.
inline void safeSave(const std::string& path, const std::string& text) {
    writeText(path + ".saving", text);
    std::filesystem::rename(path + ".saving", path);
}

// Every journaled event of the device after `since` at or below `paths`.
inline std::vector<JournalEvent> journaled(TremorService& service, uint32_t device,
                                           uint64_t since = 0,
                                           const std::vector<std::string>& paths = {}) {
    std::vector<JournalEvent> events;
    service.sync();
    TremorStore* store = service.storeForDevice(device);
    EXPECT_NE(store, nullptr);
    if (store) {
        EXPECT_TRUE(store
                        ->replay(since, paths, 0,
                                 [&](const JournalEvent& event) {
                                     events.push_back(event);
                                     return true;
                                 })
                        .ok());
    }
    return events;
}

inline const JournalEvent* findEvent(const std::vector<JournalEvent>& events,
                                     const std::string& path, uint32_t flag = 0) {
    for (const auto& event : events) {
        if (event.path == path && (event.flags & flag) == flag)
            return &event;
    }
    return nullptr;
}

inline std::string describe(const std::vector<JournalEvent>& events) {
    std::string text;
    for (const auto& event : events) {
        text += std::to_string(event.id) + " " + event.path +
                " ino=" + std::to_string(event.fileID) + " flags=" + std::to_string(event.flags) +
                "\n";
    }
    return text;
}

class TremorServiceTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        device_ = deviceOf(tree_);
    }
    // Starts the service on state_; it watches nothing until asked.
    void start() {
        auto service = TremorService::create(state_.path());
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        strata_ = std::make_shared<TremorStrataService>(service_);
    }
    void startWatching() {
        ASSERT_NO_FATAL_FAILURE(start());
        ASSERT_TRUE(service_->watchTree(tree_).ok());
    }
    uint32_t documentIdOf(const std::string& path) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0) << path;
        uint32_t docID = strata_->getOrAllocateDocumentId(fd);
        int error = errno;
        FileSystem::current().close(fd);
        errno = error;
        return docID;
    }
    std::vector<JournalEvent> documentIdEvents(uint64_t since) {
        return journaled(*service_, device_, since, {TremorStore::kDocumentIdRoot});
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    uint32_t device_ = 0;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<TremorStrataService> strata_;
};

struct Delivered {
    std::mutex mutex;
    std::vector<JournalEvent> events;

    std::vector<JournalEvent> snapshot() {
        std::lock_guard lock(mutex);
        return events;
    }
    bool has(uint32_t flag) {
        auto all = snapshot();
        return std::any_of(all.begin(), all.end(), [&](auto& event) { return event.flags & flag; });
    }
};

inline void collect(TremorStreamRef, void* info, size_t count, const ObjectRef& paths,
                    const uint32_t* flags, const uint64_t* ids) {
    auto* delivered = static_cast<Delivered*>(info);
    auto array = objectCast<Array>(paths);
    ASSERT_TRUE(array && array->count() == count);
    std::lock_guard lock(delivered->mutex);
    for (size_t i = 0; i < count; ++i) {
        auto path = objectCast<String>(array->objects()[i]);
        ASSERT_TRUE(path);
        delivered->events.push_back({ids[i], path->value(), 0, flags[i]});
    }
}

// Streams from the shared service, as clients open them.
class TremorServiceStreamTest : public TremorServiceTest {
protected:
    void SetUp() override {
        TremorServiceTest::SetUp();
        TremorService::configure(state_.path(), InotifyApi::system());
    }
    void TearDown() override {
        for (auto stream : streams_) TremorStreamRelease(stream);
        TremorService::resetForTesting();
    }

    TremorStreamRef open(Delivered& delivered, uint64_t since) {
        TremorStreamContext context{&delivered, nullptr, nullptr};
        TremorStreamRef stream =
            TremorStreamCreate(&collect, &context, {tree_}, since, 0.01,
                               kTremorCreateUseObjects | kTremorCreateFileEvents);
        EXPECT_NE(stream, nullptr);
        if (!stream)
            return nullptr;
        streams_.push_back(stream);
        TremorStreamSetDispatchQueue(stream, queue_);
        EXPECT_TRUE(TremorStreamStart(stream));
        return stream;
    }
    std::shared_ptr<TremorService> service() { return TremorService::shared().value(); }

    // Waits for everything journaled so far, then checks that the stream saw exactly the
    // journal of tree_: in order, nothing twice, nothing missing, one history-done event.
    void expectExactlyTheJournal() {
        uint64_t last = TremorsGetCurrentEventId();
        ASSERT_TRUE(eventually([&] {
            auto events = delivered_.snapshot();
            return !events.empty() && events.back().id >= last;
        }));
        std::vector<uint64_t> expected;
        for (const auto& event : journaled(*service(), device_, 0, {tree_}))
            expected.push_back(event.id);
        std::vector<uint64_t> got;
        size_t historyDone = 0;
        for (const auto& event : delivered_.snapshot()) {
            if (event.flags & kTremorHistoryDone) {
                ++historyDone;
                EXPECT_EQ(event.path, tree_);
                continue;
            }
            EXPECT_TRUE(got.empty() || event.id > got.back()) << "out of order or repeated";
            got.push_back(event.id);
        }
        EXPECT_EQ(historyDone, 1u);
        EXPECT_EQ(got, expected);
    }

    std::shared_ptr<DispatchQueue> queue_ = DispatchQueue::makeSerial("stream test");
    std::vector<TremorStreamRef> streams_;
    Delivered delivered_;  // both outlive the streams
    Delivered replayed_;
};

}  // namespace tamber::testing
