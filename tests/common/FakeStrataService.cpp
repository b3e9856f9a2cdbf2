#include "tests/common/FakeStrataService.h"

#include <sys/stat.h>

#include <cerrno>

namespace tamber::testing {

uint32_t FakeStrataService::getOrAllocateDocumentId(int fd) {
    struct stat st {};
    if (::fstat(fd, &st) != 0)
        return 0;
    std::lock_guard lock(mutex_);
    ++allocations_;
    if (allocationError_) {
        errno = allocationError_;
        return 0;
    }
    auto it = documentByInode_.find(st.st_ino);
    if (it != documentByInode_.end())
        return it->second;
    uint32_t id = nextDocument_++;
    documentByInode_[st.st_ino] = id;
    inodeByDocument_[id] = st.st_ino;
    return id;
}

uint32_t FakeStrataService::documentIdForInode(uint32_t, uint64_t inode) {
    std::lock_guard lock(mutex_);
    auto it = documentByInode_.find(inode);
    return it == documentByInode_.end() ? 0 : it->second;
}

uint64_t FakeStrataService::resolveDocumentId(uint32_t, uint32_t documentId) {
    std::lock_guard lock(mutex_);
    ++resolutions_;
    if (!resolutionErrors_.empty()) {
        errno = resolutionErrors_.front();
        resolutionErrors_.pop_front();
        return 0;
    }
    auto it = inodeByDocument_.find(documentId);
    if (it == inodeByDocument_.end()) {
        errno = ENOENT;
        return 0;
    }
    return it->second;
}

bool FakeStrataService::pathForFileId(uint32_t, uint64_t fileId, std::string& path) {
    std::lock_guard lock(mutex_);
    auto it = pathByInode_.find(fileId);
    if (it == pathByInode_.end()) {
        errno = ENOENT;
        return false;
    }
    path = it->second;
    return true;
}

void FakeStrataService::publish(const std::string& path) {
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0)
        return;
    std::lock_guard lock(mutex_);
    pathByInode_[st.st_ino] = path;
}

void FakeStrataService::failResolutions(std::deque<int> errors) {
    std::lock_guard lock(mutex_);
    resolutionErrors_ = std::move(errors);
}

int FakeStrataService::allocations() const {
    std::lock_guard lock(mutex_);
    return allocations_;
}

int FakeStrataService::resolutions() const {
    std::lock_guard lock(mutex_);
    return resolutions_;
}

}  // namespace tamber::testing
