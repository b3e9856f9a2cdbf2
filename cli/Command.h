#pragma once

#include <CLI/CLI.hpp>

#include "cli/CliContext.h"

namespace tamber {

// One verb of the command line.
class Command {
public:
    virtual ~Command() = default;
    // Declares the verb and its options on `app`; returns the subcommand.
    virtual CLI::App* add(CLI::App& app) = 0;
    // Runs the verb once its options are parsed; returns the exit status.
    virtual int run(CliContext& context) = 0;
};

}  // namespace tamber
