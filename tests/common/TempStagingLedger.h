#pragma once

#include <gtest/gtest.h>

#include <memory>

#include "host/StagingCopies.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

// Keeps the import staging ledger of a test program in a TempDir of its own instead of the
// user's state folder.
class TempStagingLedger : public ::testing::Environment {
public:
    void SetUp() override {
        ledger_ = std::make_unique<TempDir>();
        StagingCopies::setLedgerDirectoryForTesting(ledger_->path());
    }
    void TearDown() override {
        StagingCopies::setLedgerDirectoryForTesting("");
        ledger_.reset();
    }

private:
    std::unique_ptr<TempDir> ledger_;
};

}  // namespace tamber::testing
