#include "platform/strata/TremorStrataService.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <map>

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

void TremorStrataService::allocate(TremorStore& store, const std::vector<File>& files,
                                   std::vector<uint32_t>& ids) {
    std::vector<uint64_t> inodes;
    inodes.reserve(files.size());
    for (const File& file : files) inodes.push_back(file.inode);
    auto placed = store.placeInodes(inodes);
    if (!placed.ok()) {
        // Unknown is not "none": a second ID for a document would split it.
        logError("Could not read the document index: " + placed.error().description());
        errno = EIO;
        return;
    }
    std::vector<TremorStore::NewDocument> wanted;
    std::vector<size_t> wantedPositions;
    int failure = 0;
    for (size_t k = 0; k < files.size(); ++k) {
        const TremorStore::Placement& place = placed.value()[k];
        if (!place.path) {
            failure = ENOENT;  // not inside a watched tree
            continue;
        }
        if (place.docID != 0) {
            ids[files[k].position] = place.docID;
            continue;
        }
        TremorStore::NewDocument document{files[k].inode, {}};
        // Metadata the file had before it became a document (given by another program, or
        // copied in with it) follows it from now on too: kept in the transaction that gives
        // the ID. Once per document: one listing, usually empty.
        if (files[k].regular) {
            if (auto values = DocumentAttributes::read(*place.path))
                document.attributes = std::move(*values);
        }
        wanted.push_back(std::move(document));
        wantedPositions.push_back(files[k].position);
    }
    if (!wanted.empty()) {
        auto allocated = store.allocateDocumentIds(wanted);
        if (!allocated.ok()) {
            logError("Could not give document IDs: " + allocated.error().description());
            errno = EIO;
            return;
        }
        for (size_t k = 0; k < wanted.size(); ++k) {
            ids[wantedPositions[k]] = allocated.value()[k];
            logDebug([&] {
                return "document " + std::to_string(allocated.value()[k]) + " given to inode " +
                       std::to_string(wanted[k].inode);
            });
        }
    }
    if (failure != 0)
        errno = failure;
}

uint32_t TremorStrataService::getOrAllocateDocumentId(int fd) {
    // A file saved just before must be in the index before it can be given an ID.
    service_->sync();
    std::vector<uint32_t> ids(1, 0);
    struct statx st {};
    if (FileSystem::current().statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_TYPE, &st) != 0)
        return 0;
    std::map<uint32_t, std::vector<File>> byDevice;
    byDevice[encodeDevice(st.stx_dev_major, st.stx_dev_minor)].push_back(
        {0, st.stx_ino, S_ISREG(st.stx_mode)});
    allocateAll(byDevice, ids);
    return ids.front();
}

std::vector<uint32_t> TremorStrataService::getOrAllocateDocumentIds(
    const std::vector<FileName>& files) {
    std::vector<uint32_t> ids(files.size(), 0);
    service_->sync();  // as for one file
    std::map<uint32_t, std::vector<File>> byDevice;
    for (size_t i = 0; i < files.size(); ++i) {
        if (files[i].known) {
            byDevice[files[i].device].push_back({i, files[i].inode, files[i].regular});
            continue;
        }
        // Never through a final link: what a descriptor opened O_NOFOLLOW would show, without
        // opening one per file of a page.
        struct statx st {};
        if (FileSystem::current().statx(files[i].folder, files[i].name, AT_SYMLINK_NOFOLLOW,
                                        STATX_INO | STATX_TYPE, &st) != 0 ||
            !(S_ISREG(st.stx_mode) || S_ISDIR(st.stx_mode)))
            continue;
        byDevice[encodeDevice(st.stx_dev_major, st.stx_dev_minor)].push_back(
            {i, st.stx_ino, S_ISREG(st.stx_mode)});
    }
    allocateAll(byDevice, ids);
    return ids;
}

void TremorStrataService::allocateAll(const std::map<uint32_t, std::vector<File>>& byDevice,
                                      std::vector<uint32_t>& ids) {
    int failure = 0;
    for (const auto& [device, files] : byDevice) {
        TremorStore* store = service_->storeForDevice(device);
        if (!store) {
            failure = EXDEV;
            continue;
        }
        errno = 0;
        allocate(*store, files, ids);
        if (errno != 0)
            failure = errno;
    }
    // The one file of a single ask tells why it has none.
    if (failure != 0)
        errno = failure;
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
