#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <string>

#include "platform/tremors/InodeRecord.h"

namespace tamber {

// What the journal's index keeps of a file to know it again: its inode number, kind, birth,
// size and times, read with statx without following links. The comparisons say when an entry
// and a newer look at it are the same file, and when that file changed.
class FileStamp {
public:
    // The statx fields an index entry keeps.
    static constexpr unsigned kMask =
        STATX_INO | STATX_TYPE | STATX_BTIME | STATX_CTIME | STATX_MTIME | STATX_SIZE;

    // Reads those fields of `path` through the current file system; false when it cannot.
    static bool read(const std::string& path, struct statx& st);

    // What tells a file from a later one given the same inode number: its birth time where the
    // file system keeps one, else (for all but directories) its change time. The change time
    // also moves when the file is changed or renamed while nothing watches; such a file then
    // reads as replaced and keeps its document ID only if it is still at its path (the
    // safe-save rule), which is the safe way to be wrong. 0 when there is nothing to go by.
    static uint64_t birthOf(const struct statx& st);
    // The index entry of the file `st` describes, named `name` in the folder `parent`.
    static InodeRecord recordOf(const struct statx& st, uint64_t parent, std::string name);

    // Whether the file system told the file's birth time.
    static bool hasBirthTime(const struct statx& st);
    static uint8_t kindOf(uint32_t mode);
    // The event flag that names an entry's kind (file, folder, link), 0 for anything else.
    static uint32_t kindFlag(uint8_t kind);

    // Whether the indexed entry is the file `st` describes, as seen while watching: only a
    // birth time tells a reused inode number from the file itself (a change time moves with
    // every write).
    static bool isIndexedFile(const InodeRecord& indexed, const struct statx& st);
    // The same file: a reused inode number of another kind or birth is another file. Entries
    // without a birth (indexed before it was kept, or on a file system without one) can only be
    // told apart by kind.
    static bool sameFile(const InodeRecord& indexed, const InodeRecord& found);
    // Whether a file's contents changed while nothing watched. A directory's own size and time
    // change with its entries, which are reported one by one.
    static bool changedWhileAway(const InodeRecord& indexed, const InodeRecord& found);
    // Whether the index must be told about `found`, a newer look at the entry it keeps as
    // `indexed`.
    static bool differs(const InodeRecord& indexed, InodeRecord found);
};

}  // namespace tamber
