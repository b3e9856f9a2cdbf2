#pragma once

#include <cstdint>

namespace tamber {

// What the identifier code asks of an open descriptor in one query.
struct CommonAttributes {
    uint32_t device = 0;      // 32-bit device number
    uint32_t mode = 0;        // file type and permission bits
    uint32_t documentId = 0;  // 0 when the file has none yet
    uint64_t fileId = 0;      // inode number
};

// statx on the descriptor plus a document-ID look-up (no allocation). 0 on success, -1 and
// errno on failure.
int GetAttributeList(int fd, CommonAttributes& out);

}  // namespace tamber
