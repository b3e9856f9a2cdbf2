#pragma once

namespace tamber {

// Parses the arguments, runs the verb and returns the process exit status.
int runCommandLine(int argc, char** argv);

}  // namespace tamber
