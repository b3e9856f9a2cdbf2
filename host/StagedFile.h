#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/Url.h"
#include "support/Result.h"

namespace tamber {

// A regular file written in pieces (a file sent over the network, a new version of a file)
// under a hidden staging name in the folder it is meant for, and put in place whole: nothing
// half-written ever shows under a real name. The staging file is recorded in the staging ledger
// while it exists (see StagingCopies), so a process killed part-way leaves nothing the next
// sweep misses; one that is dropped without being put in place is removed.
//
// The folder must lie inside the published trees; it is opened beneath its root once, and every
// later step works relative to that descriptor.
class StagedFile {
public:
    // Creates the staging file in `folder` with the permission bits `mode` (the umask applies).
    static Result<std::unique_ptr<StagedFile>> create(const Url& folder, mode_t mode = 0644);
    ~StagedFile();
    StagedFile(const StagedFile&) = delete;
    StagedFile& operator=(const StagedFile&) = delete;

    // Appends `size` bytes. After a failure the file is spoiled: later writes fail too.
    Status write(const void* data, size_t size);
    uint64_t size() const { return size_; }

    // Flushes the file to disk and gives it `name` in the folder, bouncing ("name 2.ext", ...)
    // when the name is taken. A name a caller may not give (see checkItemName) fails with the
    // invalid-parameter error and removes the staging file.
    Result<Url> place(const std::string& name);

    // A safe save over the regular file `name` of the folder: flushes the file to disk, gives it
    // that file's permission bits and extended attributes, and renames it over the file, which
    // readers then see changed at once and whole. A folder or a symbolic link under `name` is
    // refused (EISDIR, ELOOP) and left alone, as is a missing file (ENOENT).
    Result<Url> replace(const std::string& name);

    // Removes the staging file now (the destructor does it too).
    void discard();

    const std::string& stagingName() const { return name_; }

private:
    StagedFile(Url folder, int folderFd, std::string name, int fd);
    Status flush();
    Status copyAttributesFrom(const std::string& name);
    void forget();

    Url folder_;
    int folderFd_ = -1;
    std::string name_;  // the staging name
    int fd_ = -1;       // open for writing until flushed
    uint64_t size_ = 0;
    bool failed_ = false;
    bool settled_ = false;  // placed, replaced or discarded
};

}  // namespace tamber
