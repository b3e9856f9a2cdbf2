#include <cstdio>
#include <exception>

#include "cli/CommandLine.h"

int main(int argc, char** argv) {
    // Whatever escapes a verb ends as one line and a failure status, never as an abort with a
    // core dump and the runtime's own message.
    try {
        return tamber::runCommandLine(argc, argv);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "tamber: internal error: %s\n", e.what());
    } catch (...) {
        std::fprintf(stderr, "tamber: internal error: unknown exception\n");
    }
    return 1;
}
