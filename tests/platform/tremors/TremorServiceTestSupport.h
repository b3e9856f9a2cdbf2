#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/FileSystem.h"
#include "platform/strata/StrataService.h"
#include "platform/tremors/JournalEvent.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"

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
    std::string temporary = path + ".saving";
    writeText(temporary, text);
    std::filesystem::rename(temporary, path);
}

inline std::shared_ptr<TremorService> startService(const std::string& stateDir,
                                                   const std::string& tree) {
    auto service = TremorService::create(stateDir);
    EXPECT_TRUE(service.ok()) << (service.ok() ? "" : service.error().description());
    if (!service.ok())
        return nullptr;
    EXPECT_FALSE(service.value()->watchTree(tree));
    return service.value();
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
        EXPECT_FALSE(store->replay(since, paths, 0, [&](const JournalEvent& event) {
            events.push_back(event);
            return true;
        }));
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

}  // namespace tamber::testing
