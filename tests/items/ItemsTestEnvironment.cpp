#include "tests/common/PublishedTempBase.h"
#include "tests/common/TempStagingLedger.h"

namespace {

// Attribute writes only work inside the published trees; these tests work in TempDirs.
const auto* const environment =
    ::testing::AddGlobalTestEnvironment(new tamber::testing::PublishedTempBase);
const auto* const ledger =
    ::testing::AddGlobalTestEnvironment(new tamber::testing::TempStagingLedger);

}  // namespace
