#include "platform/strata/TremorStrataService.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/FileSystem.h"
#include "platform/Url.h"
#include "platform/strata/DocumentAttributes.h"
#include "platform/tremors/TremorService.h"
#include "support/Log.h"

namespace tamber {

void TremorStrataService::installDocumentIdLookup() {
    setDocumentIdLookup(&TremorStrataService::lookUpDocumentId);
}

namespace {

// Identifier look-ups answer nothing when the index cannot be read; the cause is logged here,
// once. Callers that would act on "nothing" (hand out a new ID) check the read themselves.
template <class T>
std::optional<T> orLogged(Result<std::optional<T>> read) {
    if (read.ok())
        return std::move(read).value();
    logError("Could not read the document index: " + read.error().description());
    return std::nullopt;
}

}  // namespace

std::optional<uint32_t> TremorStrataService::lookUpDocumentId(const std::string& path) {
    // A look-up must not start the journal: it answers only for a running one.
    auto service = TremorService::sharedIfRunning();
    if (!service)
        return std::nullopt;
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_INO, &st) != 0)
        return std::nullopt;
    TremorStore* store = service->storeForDevice(encodeDevice(st.stx_dev_major, st.stx_dev_minor));
    if (!store)
        return std::nullopt;
    return orLogged(store->documentIdForInode(st.stx_ino));
}

uint32_t TremorStrataService::getOrAllocateDocumentId(int fd) {
    // A file saved just before must be in the index before it can be given an ID.
    service_->sync();
    struct statx st {};
    if (FileSystem::current().statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_TYPE, &st) != 0)
        return 0;
    TremorStore* store = service_->storeForDevice(encodeDevice(st.stx_dev_major, st.stx_dev_minor));
    if (!store) {
        errno = EXDEV;
        return 0;
    }
    auto path = store->pathForInode(st.stx_ino);
    Result<std::optional<uint32_t>> existing = path.ok()
                                                   ? store->documentIdForInode(st.stx_ino)
                                                   : Result<std::optional<uint32_t>>(path.error());
    if (!existing.ok()) {
        // Unknown is not "none": a second ID for a document would split it.
        logError("Could not read the document index: " + existing.error().description());
        errno = EIO;
        return 0;
    }
    if (!path.value()) {
        errno = ENOENT;  // not inside a watched tree
        return 0;
    }
    if (existing.value())
        return *existing.value();
    auto docID = store->allocateDocumentId(st.stx_ino);
    if (!docID.ok()) {
        errno = EIO;
        return 0;
    }
    // Metadata the file had before it became a document (given by another program, or copied
    // in with it) follows it from now on too. Once per document: one listing, usually empty.
    if (S_ISREG(st.stx_mode)) {
        auto values = DocumentAttributes::read(*path.value());
        if (values && !values->empty()) {
            if (auto status = store->replaceDocumentAttributes(docID.value(), *values);
                !status.ok())
                logError("Could not keep a document's metadata: " + status.error().description());
        }
    }
    return docID.value();
}

uint32_t TremorStrataService::documentIdForInode(uint32_t device, uint64_t inode) {
    TremorStore* store = service_->storeForDevice(device);
    if (!store) {
        errno = ENOENT;
        return 0;
    }
    return orLogged(store->documentIdForInode(inode)).value_or(0);
}

uint64_t TremorStrataService::resolveDocumentId(uint32_t device, uint32_t documentId) {
    if (!service_->indexReady()) {
        errno = EAGAIN;
        return 0;
    }
    // A save or move that completed before the call must be in the index: resolving an
    // identifier right after the provider moved its file would otherwise find the old place.
    service_->sync();
    TremorStore* store = service_->storeForDevice(device);
    auto inode = store ? orLogged(store->inodeForDocumentId(documentId)) : std::nullopt;
    if (!inode) {
        errno = ENOENT;
        return 0;
    }
    return *inode;
}

bool TremorStrataService::pathForFileId(uint32_t device, uint64_t fileId, std::string& path) {
    service_->sync();  // as for document IDs: a rename that completed is in the index
    TremorStore* store = service_->storeForDevice(device);
    auto found = store ? orLogged(store->pathForInode(fileId)) : std::nullopt;
    if (!found) {
        errno = ENOENT;
        return false;
    }
    path = std::move(*found);
    return true;
}

void TremorStrataService::metadataAttributeWritten(
    int fd, const std::string& name, const std::optional<std::vector<uint8_t>>& value) {
    if (!DocumentAttributes::isKept(name))
        return;
    // A save that completed before must be indexed first, or the copy would be kept for the
    // inode the document just left.
    service_->sync();
    struct statx st {};
    if (FileSystem::current().statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_TYPE, &st) != 0 ||
        !S_ISREG(st.stx_mode))
        return;
    TremorStore* store = service_->storeForDevice(encodeDevice(st.stx_dev_major, st.stx_dev_minor));
    auto docID = store ? orLogged(store->documentIdForInode(st.stx_ino)) : std::nullopt;
    if (!docID)
        return;
    if (auto status = store->setDocumentAttribute(*docID, name, value); !status.ok())
        logError("Could not keep a document's metadata: " + status.error().description());
}

}  // namespace tamber
