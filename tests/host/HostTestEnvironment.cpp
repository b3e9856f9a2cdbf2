#include "tests/common/PublishedTempBase.h"

namespace {

// Host operations only work inside the published trees; these tests work in TempDirs.
const auto* const environment =
    ::testing::AddGlobalTestEnvironment(new tamber::testing::PublishedTempBase);

}  // namespace
