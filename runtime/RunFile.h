#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/Url.h"
#include "support/Result.h"

namespace tamber {

// What a running server tells its clients: who it is, where it listens and its access token.
struct RunFileRecord {
    pid_t pid = 0;
    int port = 0;
    std::string token;
    std::string storage;  // the document storage folder it serves (absolute path)
};

// The file "serve.json" through which the command line finds a running server:
// $XDG_RUNTIME_DIR/tamber/serve.json, or $XDG_STATE_HOME/tamber/run/serve.json (default
// ~/.local/state/tamber/run) when there is no runtime folder. The folder is made private (0700)
// and the file readable by its owner only (0600): it holds the token.
class RunFile {
public:
    static Url defaultLocation();

    // Writes the record atomically, creating the folder.
    static Status write(const Url& file, const RunFileRecord& record);
    // The record; a missing file is HostPlatformErrorDomain 260, a malformed one EINVAL.
    static Result<RunFileRecord> read(const Url& file);
    // Removes the file when it still names `pid` (a later server may have replaced it).
    static void remove(const Url& file, pid_t pid);

    // Whether a process with this ID exists.
    static bool isAlive(pid_t pid);
    // The record of a live server serving `storagePath` (compared as absolute paths), if any.
    static std::optional<RunFileRecord> liveServerFor(const Url& file,
                                                      const std::string& storagePath);
};

}  // namespace tamber
