#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/strata/StrataService.h"

namespace tamber {

class TremorService;

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
    uint32_t documentIdForInode(uint32_t device, uint64_t inode) override;
    uint64_t resolveDocumentId(uint32_t device, uint32_t documentId) override;
    bool pathForFileId(uint32_t device, uint64_t fileId, std::string& path) override;
    void metadataAttributeWritten(int fd, const std::string& name,
                                  const std::optional<std::vector<uint8_t>>& value) override;

private:
    const std::shared_ptr<TremorService> service_;
};

}  // namespace tamber
