#pragma once

#include <string>
#include <vector>

namespace tamber::testing {

struct CliRun {
    int status;
    std::string out;
    std::string err;
};

// Runs the command line in-process with `args` (without the program name), log lines kept out
// of the test output.
CliRun runTamber(std::vector<std::string> args);

}  // namespace tamber::testing
