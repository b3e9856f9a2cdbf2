#include "platform/strata/StrataService.h"
#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/ProcessWide.h"

#include <fcntl.h>

#include <atomic>
#include <cerrno>
#include <cstring>

namespace tamber {

namespace {

std::shared_ptr<StrataService>& slot() {
    static ProcessWide<std::shared_ptr<StrataService>> service;
    return *service;
}

}  // namespace

std::shared_ptr<StrataService> StrataService::current() {
    return std::atomic_load(&slot());
}

std::shared_ptr<StrataService> StrataService::setCurrent(std::shared_ptr<StrataService> service) {
    return std::atomic_exchange(&slot(), std::move(service));
}

std::vector<uint32_t> StrataService::getOrAllocateDocumentIds(const std::vector<FileName>& files) {
    std::vector<uint32_t> ids;
    ids.reserve(files.size());
    for (const FileName& file : files) {
        ScopedFd fd(FileSystem::current().openat(file.folder, file.name,
                                                 O_PATH | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        ids.push_back(fd.ok() ? getOrAllocateDocumentId(fd.get()) : 0);
    }
    return ids;
}

void StrataService::metadataAttributeWritten(int, const std::string&,
                                             const std::optional<std::vector<uint8_t>>&) {}

uint32_t StrataLibraryGetOrAllocateDocumentId(int fd) {
    auto service = StrataService::current();
    if (!service) {
        errno = ENOSYS;
        return 0;
    }
    return service->getOrAllocateDocumentId(fd);
}

uint64_t StrataLibraryResolveDocumentId2(uint32_t device, uint32_t documentId) {
    auto service = StrataService::current();
    if (!service) {
        errno = ENOSYS;
        return 0;
    }
    return service->resolveDocumentId(device, documentId);
}

int PathFromFileID(uint32_t device, uint64_t fileId, char* buffer, size_t size) {
    auto service = StrataService::current();
    if (!service) {
        errno = ENOSYS;
        return -1;
    }
    std::string path;
    if (!service->pathForFileId(device, fileId, path))
        return -1;
    if (path.size() + 1 > size) {
        errno = ERANGE;
        return -1;
    }
    std::memcpy(buffer, path.c_str(), path.size() + 1);
    return 0;
}

uint32_t encodeDevice(uint32_t major, uint32_t minor) {
    return (minor & 0xffu) | (major << 8) | ((minor & ~0xffu) << 12);
}

}  // namespace tamber
