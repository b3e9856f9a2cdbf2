#pragma once

#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdio>
#include <memory>
#include <string>

#include "platform/tremors/TremorStore.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

// The store of the volume `fsid` under `stateDir`, or null (and a failed test) when it can't
// be opened.
inline std::unique_ptr<TremorStore> openTestStore(const std::string& stateDir, uint64_t fsid) {
    auto store = TremorStore::open(stateDir, fsid);
    EXPECT_TRUE(store.ok()) << (store.ok() ? "" : store.error().description());
    return store.ok() ? std::move(store).value() : nullptr;
}

// The database file of that store.
inline std::string testStoreDatabase(const TempDir& state, uint64_t fsid) {
    char volume[17];
    std::snprintf(volume, sizeof volume, "%016" PRIx64, fsid);
    return state / (std::string(volume) + "/journal.sqlite");
}

}  // namespace tamber::testing
