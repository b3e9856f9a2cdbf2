#include <cstdio>
#include <exception>

#include "cli/CommandLine.h"
#include "runtime/ProviderRuntime.h"

int main(int argc, char** argv) {
    // Whatever escapes a verb ends as one line and a failure status, never as an abort with a
    // core dump and the runtime's own message.
    try {
        int status = tamber::runCommandLine(argc, argv);
        // The journal writes what it read and closes, and every thread is joined, before the
        // process's statics go away.
        tamber::ProviderRuntime::shutdownProcess();
        return status;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "tamber: internal error: %s\n", e.what());
    } catch (...) {
        std::fprintf(stderr, "tamber: internal error: unknown exception\n");
    }
    return 1;
}
