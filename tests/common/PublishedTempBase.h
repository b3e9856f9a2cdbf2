#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <memory>

#include "host/HostPorterManager.h"
#include "host/RecordingHostPorterManager.h"
#include "host/StagingCopies.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

// For test programs whose tests exercise file operations in TempDirs rather than the boundary:
// publishes the folder that holds every TempDir (resolved, so that no link lies below it) as
// the document storage, and keeps the staging ledger in a TempDir of its own. Tests of the
// boundary install their own manager for their scope.
class PublishedTempBase : public ::testing::Environment {
public:
    void SetUp() override {
        const char* base = std::getenv("TMPDIR");
        std::filesystem::path path = std::filesystem::canonical(base && *base ? base : "/tmp");
        previous_ = HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(path.string())));
        ledger_ = std::make_unique<TempDir>();
        StagingCopies::setLedgerDirectoryForTesting(ledger_->path());
    }
    void TearDown() override {
        StagingCopies::setLedgerDirectoryForTesting("");
        ledger_.reset();
        HostPorterManager::installDefaultManager(previous_);
    }

private:
    std::unique_ptr<TempDir> ledger_;
    std::shared_ptr<HostPorterManager> previous_;
};

}  // namespace tamber::testing
