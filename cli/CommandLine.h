#pragma once

#include <iosfwd>

namespace tamber {

// Parses the arguments, runs the verb and returns the process exit status.
int runCommandLine(int argc, char** argv);
// The same with the output streams given (tests).
int runCommandLine(int argc, char** argv, std::ostream& out, std::ostream& err);

}  // namespace tamber
