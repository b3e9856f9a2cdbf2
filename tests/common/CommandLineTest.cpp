#include "tests/common/CommandLineTest.h"

#include <cstdlib>

#include "platform/apps/AppRegistry.h"
#include "platform/tremors/TremorService.h"

namespace tamber::testing {

namespace {

void restore(const char* name, const std::optional<std::string>& value) {
    if (value)
        setenv(name, value->c_str(), 1);
    else
        unsetenv(name);
}

std::optional<std::string> replace(const char* name, const std::string& value) {
    std::optional<std::string> previous;
    if (const char* old = std::getenv(name))
        previous = old;
    setenv(name, value.c_str(), 1);
    return previous;
}

}  // namespace

void CommandLineTest::SetUp() {
    AppLibraryTest::SetUp();
    AppRegistry::setDefaultRegistry(nullptr);
    previousDataDirs_ = replace("XDG_DATA_DIRS", systemData.path());
    previousRuntimeDir_ = replace("XDG_RUNTIME_DIR", runtimeDir.path());
    TremorService::resetForTesting();
    TremorService::configure(state.path());
    storage = dir.makeDir("Documents");
}

void CommandLineTest::TearDown() {
    TremorService::resetForTesting();
    restore("XDG_DATA_DIRS", previousDataDirs_);
    restore("XDG_RUNTIME_DIR", previousRuntimeDir_);
    AppLibraryTest::TearDown();
}

CliRun CommandLineTest::tamber(std::vector<std::string> args) {
    if (auto service = TremorService::sharedIfRunning())
        service->sync();
    args.insert(args.begin(), {"--storage", storage});
    return runTamber(std::move(args));
}

}  // namespace tamber::testing
