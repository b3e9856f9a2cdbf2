#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tamber {

// Document IDs and file-ID resolution for the published trees. The journal service provides
// the real one; tests install fakes (for example one that answers EAGAIN a few times).
// Failures answer 0 (or -1) with errno set, like the system calls they stand in for.
class StrataService {
public:
    virtual ~StrataService() = default;

    // The process-wide service; null until one is installed.
    static std::shared_ptr<StrataService> current();
    static std::shared_ptr<StrataService> setCurrent(std::shared_ptr<StrataService> service);

    // The document ID of the open file, allocating the next one when it has none. Pending
    // file-system events are applied first, so a file saved just before is known.
    virtual uint32_t getOrAllocateDocumentId(int fd) = 0;
    // A file named relative to an open folder, or by absolute path with `folder` AT_FDCWD.
    struct FileName {
        int folder;
        std::string name;
        // Set when the caller read the file's status moments before (a listing's entry): its
        // volume (as encodeDevice gives it), inode and whether it is a regular file (else a
        // package folder). The journal's service then makes no status query of its own.
        bool known = false;
        uint32_t device = 0;
        uint64_t inode = 0;
        bool regular = false;
    };
    // The same for each of `files` (a regular file or a package folder, never followed through
    // a final link), in order, with 0 for one that got no ID. The default opens each and asks
    // for it in turn; the journal's service syncs once, reads its index once and writes the new
    // IDs in one transaction (a listing asks for a page of files at a time, each relative to
    // the listed folder: one name lookup, no descriptor).
    virtual std::vector<uint32_t> getOrAllocateDocumentIds(const std::vector<FileName>& files);
    // The document ID of an inode, 0 when it has none (never allocates).
    virtual uint32_t documentIdForInode(uint32_t device, uint64_t inode) = 0;
    // The file ID that holds a document now; 0 and ENOENT when unknown, EAGAIN while the index
    // is being rebuilt.
    virtual uint64_t resolveDocumentId(uint32_t device, uint32_t documentId) = 0;
    // The absolute path of a file ID inside the watched trees; false and errno when none (only
    // files inside the published folders ever resolve).
    virtual bool pathForFileId(uint32_t device, uint64_t fileId, std::string& path) = 0;
    // Tamber set (or, with no value, removed) the metadata attribute `name` of the open file:
    // the document's copy of its metadata follows at once, without waiting for the file's
    // attribute event. Other attributes and files without a document ID are left alone. The
    // default keeps no copies.
    virtual void metadataAttributeWritten(int fd, const std::string& name,
                                          const std::optional<std::vector<uint8_t>>& value);
};

// The platform's names for the service's calls.
uint32_t StrataLibraryGetOrAllocateDocumentId(int fd);
uint64_t StrataLibraryResolveDocumentId2(uint32_t device, uint32_t documentId);
// Writes the path into `buffer` (at most `size` bytes with the terminating NUL); -1 and errno
// on failure (ERANGE when it does not fit).
int PathFromFileID(uint32_t device, uint64_t fileId, char* buffer, size_t size);

// The 32-bit device number of a statx device (the kernel's encoding of major and minor).
uint32_t encodeDevice(uint32_t major, uint32_t minor);

}  // namespace tamber
