#include "tests/common/TempStagingLedger.h"

namespace {

// Imports record their staging copies; keep those records out of the user's state folder.
const auto* const ledger =
    ::testing::AddGlobalTestEnvironment(new tamber::testing::TempStagingLedger);

}  // namespace
