#pragma once

#include <deque>
#include <map>
#include <mutex>
#include <string>

#include "platform/strata/StrataService.h"

namespace tamber::testing {

// An in-memory document-ID service: documents are numbered from 1 on first request, paths are
// told by the test, and resolution failures can be scripted.
class FakeStrataService : public StrataService {
public:
    uint32_t getOrAllocateDocumentId(int fd) override;
    uint32_t documentIdForInode(uint32_t device, uint64_t inode) override;
    uint64_t resolveDocumentId(uint32_t device, uint32_t documentId) override;
    bool pathForFileId(uint32_t device, uint64_t fileId, std::string& path) override;

    // Makes `path` resolvable by its inode (as the journal's index would).
    void publish(const std::string& path);
    // The next resolutions fail with these errno values, in order.
    void failResolutions(std::deque<int> errors);
    void failAllocation(int error) { allocationError_ = error; }

    int allocations() const;
    int resolutions() const;

private:
    mutable std::mutex mutex_;
    std::map<uint64_t, uint32_t> documentByInode_;
    std::map<uint32_t, uint64_t> inodeByDocument_;
    std::map<uint64_t, std::string> pathByInode_;
    std::deque<int> resolutionErrors_;
    int allocationError_ = 0;
    uint32_t nextDocument_ = 1;
    int allocations_ = 0;
    int resolutions_ = 0;
};

}  // namespace tamber::testing
