#include "tests/common/PublishedTempBase.h"

namespace {

// Host operations only work inside the published trees; these tests work in TempDirs.
const bool registered = tamber::testing::addTempFileOperationEnvironments();

}  // namespace
