#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber serve [--port N] [--no-open]`: runs the server for the storage folder until SIGINT or
// SIGTERM, then stops it in order and exits 0. Prints one line, the URL to open, on standard
// output; opens it in a browser when there is a display, unless --no-open.
class ServeCommand : public Command {
public:
    static constexpr int kDefaultPort = 8177;

    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    int port_ = kDefaultPort;
    bool noOpen_ = false;
    std::string webRoot_;
};

}  // namespace tamber
