#pragma once

#include <string>

#include "support/Result.h"

namespace tamber {

// Imports assemble their copy under a hidden staging name in the destination folder
// (".tamber-import-<pid>-<random>") and rename it into place. A process killed part-way leaves
// the staging copy behind; the ledger makes finding those cheap without walking the trees: each
// staging copy is recorded, while it exists, as a symbolic link "<pid>-<random>" to it in the
// ledger folder (under the program's state folder). The sweep reads only the ledger.
class StagingCopies {
public:
    static constexpr const char* kPrefix = ".tamber-import-";

    // The ledger folder: $XDG_STATE_HOME/tamber/staging, or ~/.local/state/tamber/staging.
    static std::string ledgerDirectory();
    // Tests point the ledger elsewhere; an empty path restores the default. Returns the
    // previous setting.
    static std::string setLedgerDirectoryForTesting(std::string path);

    // A fresh staging name carrying this process's id.
    static std::string makeName();
    // The process id a staging name carries; 0 when it is not one.
    static long pidOfName(const std::string& name);

    // Records the staging copy at `path` in the ledger (a failure is logged only: the import
    // goes on, only the sweep would not find it) and forgets it again.
    static void record(const std::string& path);
    static void forget(const std::string& path);

    // Removes every recorded staging copy whose process is gone, if it still lies inside the
    // published trees, and its record. Returns how many copies were removed.
    static size_t sweepStale();
};

}  // namespace tamber
