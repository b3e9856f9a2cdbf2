#include "cli/CommandLine.h"

int main(int argc, char** argv) {
    return tamber::runCommandLine(argc, argv);
}
