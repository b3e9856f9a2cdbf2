#pragma once

#include <optional>
#include <string>
#include <vector>

#include "tests/common/AppLibraryTest.h"
#include "tests/common/CliRunner.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

// What a test of the command line starts from: a storage folder "Documents" in a temporary
// folder, the real event journal kept in a temporary state folder, and only the applications
// the test installs (the system's own are hidden), and a private runtime folder, so that the verbs
// find only the servers the test starts (its run files go there).
class CommandLineTest : public AppLibraryTest {
protected:
    void SetUp() override;
    void TearDown() override;

    // Runs a verb on the storage in this process, once the journal has taken in what happened
    // before, as it would have before a separate process started.
    CliRun tamber(std::vector<std::string> args);

    TempDir state, systemData, runtimeDir;
    std::string storage;

private:
    std::optional<std::string> previousDataDirs_;
    std::optional<std::string> previousRuntimeDir_;
};

}  // namespace tamber::testing
