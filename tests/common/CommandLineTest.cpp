#include "tests/common/CommandLineTest.h"

#include <cstdlib>

#include "platform/apps/AppRegistry.h"
#include "platform/tremors/TremorService.h"

namespace tamber::testing {

void CommandLineTest::SetUp() {
    AppLibraryTest::SetUp();
    AppRegistry::setDefaultRegistry(nullptr);
    if (const char* dirs = std::getenv("XDG_DATA_DIRS"))
        previousDataDirs_ = dirs;
    setenv("XDG_DATA_DIRS", systemData.path().c_str(), 1);
    TremorService::resetForTesting();
    TremorService::configure(state.path());
    storage = dir.makeDir("Documents");
}

void CommandLineTest::TearDown() {
    TremorService::resetForTesting();
    if (previousDataDirs_)
        setenv("XDG_DATA_DIRS", previousDataDirs_->c_str(), 1);
    else
        unsetenv("XDG_DATA_DIRS");
    AppLibraryTest::TearDown();
}

CliRun CommandLineTest::tamber(std::vector<std::string> args) {
    if (auto service = TremorService::sharedIfRunning())
        service->sync();
    args.insert(args.begin(), {"--storage", storage});
    return runTamber(std::move(args));
}

}  // namespace tamber::testing
