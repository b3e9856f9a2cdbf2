#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <memory>

#include "host/HostPorterManager.h"
#include "host/RecordingHostPorterManager.h"
#include "tests/common/TempStagingLedger.h"

namespace tamber::testing {

// For test programs whose tests exercise file operations in TempDirs rather than the boundary:
// publishes the folder that holds every TempDir (resolved, so that no link lies below it) as
// the document storage. Tests of the boundary install their own manager for their scope.
class PublishedTempBase : public ::testing::Environment {
public:
    void SetUp() override {
        const char* base = std::getenv("TMPDIR");
        std::filesystem::path path = std::filesystem::canonical(base && *base ? base : "/tmp");
        previous_ = HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(path.string())));
    }
    void TearDown() override { HostPorterManager::installDefaultManager(previous_); }

private:
    std::shared_ptr<HostPorterManager> previous_;
};

// For a test program of file operations in TempDirs: the temporary folder is published, and
// import staging copies are recorded in a ledger of the program's own.
inline bool addTempFileOperationEnvironments() {
    ::testing::AddGlobalTestEnvironment(new PublishedTempBase);
    ::testing::AddGlobalTestEnvironment(new TempStagingLedger);
    return true;
}

}  // namespace tamber::testing
