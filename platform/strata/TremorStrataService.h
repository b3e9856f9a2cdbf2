#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/strata/StrataService.h"

namespace tamber {

class TremorService;
class TremorStore;

// Document IDs and file-ID resolution from the event journal's index of the watched trees.
// Only files inside watched trees have document IDs or resolve to paths: identifiers can never
// name a file outside the published folders.
class TremorStrataService : public StrataService {
public:
    explicit TremorStrataService(std::shared_ptr<TremorService> service)
        : service_(std::move(service)) {}

    // Makes Url's document-ID key read the index of the process's service.
    static void installDocumentIdLookup();
    static std::optional<uint32_t> lookUpDocumentId(const std::string& path);

    uint32_t getOrAllocateDocumentId(int fd) override;
    std::vector<uint32_t> getOrAllocateDocumentIds(const std::vector<FileName>& files) override;
    uint32_t documentIdForInode(uint32_t device, uint64_t inode) override;
    uint64_t resolveDocumentId(uint32_t device, uint32_t documentId) override;
    bool pathForFileId(uint32_t device, uint64_t fileId, std::string& path) override;
    void metadataAttributeWritten(int fd, const std::string& name,
                                  const std::optional<std::vector<uint8_t>>& value) override;

private:
    // An open file to give a document ID, as statx found it.
    struct File {
        size_t position = 0;  // in the caller's list
        uint64_t inode = 0;
        bool regular = false;
    };
    // Gives each of `files` (all on the volume of `store`) its ID in `ids`; a failure leaves 0
    // and sets errno (EIO: the index could not be read or written, ENOENT: not in a watched
    // tree).
    static void allocate(TremorStore& store, const std::vector<File>& files,
                         std::vector<uint32_t>& ids);
    // The same for files of any volume, grouped by device.
    void allocateAll(const std::map<uint32_t, std::vector<File>>& byDevice,
                     std::vector<uint32_t>& ids);

    const std::shared_ptr<TremorService> service_;
};

}  // namespace tamber
