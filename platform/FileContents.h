#pragma once

#include <sys/types.h>

#include "platform/Url.h"
#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// Whole-file reads and atomic whole-file writes, through FileSystem::current() so that tests
// can make any step fail.
class FileContents {
public:
    // The whole file. A missing file is HostPlatformErrorDomain code 260; any other failure is
    // the POSIX error of the failing call.
    static Result<Bytes> read(const Url& url);

    // Creates the directory and any missing parent. An existing directory is not an error.
    static Status createDirectory(const Url& url);

    // Replaces the file with `bytes` so that a reader sees either the old or the new content,
    // never a mix: the bytes go to a temporary file in the same directory, are flushed to disk
    // and then renamed over the target. On failure the target is untouched and the temporary
    // file removed. `mode` is the new file's permissions (less the process's umask).
    static Status writeAtomically(const Url& url, const Bytes& bytes, mode_t mode = 0666);
};

}  // namespace tamber
