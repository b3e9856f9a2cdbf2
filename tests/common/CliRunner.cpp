#include "tests/common/CliRunner.h"

#include <sstream>

#include "cli/CommandLine.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber::testing {

CliRun runTamber(std::vector<std::string> args) {
    args.insert(args.begin(), "tamber");
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    std::ostringstream out, err;
    ScopedLogCapture quiet;
    int status = runCommandLine(static_cast<int>(args.size()), argv.data(), out, err);
    return {status, out.str(), err.str()};
}

}  // namespace tamber::testing
