#pragma once

#include <cstdint>
#include <string>

namespace tamber {

// One entry of the index of the watched trees: where an inode sits and its document ID.
struct InodeRecord {
    enum Kind : uint8_t { kFile = 1, kDirectory = 2, kSymlink = 3, kOther = 4 };

    uint64_t inode = 0;
    uint64_t parent = 0;  // the containing directory's inode
    std::string name;     // the name within the parent
    uint8_t kind = kOther;
    uint32_t docID = 0;  // 0: none

    // How the file looked when it was last seen, so that a restart can tell a file changed while
    // nothing watched, and an inode number reused by another file, from the file itself.
    // Entries indexed before these were kept have `stamped` false.
    uint64_t birth = 0;  // see FileStamp::birthOf; 0: unknown
    uint64_t size = 0;
    int64_t mtime = 0;  // nanoseconds since the epoch
    // Moves with attribute changes too: a restart rereads the kept metadata of a document whose
    // change time moved. 0: unknown (indexed before it was kept).
    int64_t ctime = 0;
    bool stamped = false;

    friend bool operator==(const InodeRecord&, const InodeRecord&) = default;
};

}  // namespace tamber
