#pragma once

#include <cstddef>
#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber search QUERY [--tag T] [--type T] [--favorites] [--recent] [--trashed] [--limit N]
// [--json]`: the running server's search over what it has listed, one item a line as `ls`
// prints them. The index lives in the server: without one, the verb says to start it.
class SearchCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

    // The request's path and query for these options (percent-encoded).
    std::string requestPath() const;

private:
    std::string query_;
    std::string tag_;
    std::string type_;
    bool favorites_ = false;
    bool recent_ = false;
    bool trashed_ = false;
    size_t limit_ = 0;
    bool json_ = false;
};

}  // namespace tamber
