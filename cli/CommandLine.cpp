#include "cli/CommandLine.h"

#include <CLI/CLI.hpp>

namespace tamber {

int runCommandLine(int argc, char** argv) {
    CLI::App app{"tamber: publishes on-disk documents to a file browser"};
    app.set_version_flag("--version", TAMBER_VERSION);
    CLI11_PARSE(app, argc, argv);
    return 0;
}

}  // namespace tamber
