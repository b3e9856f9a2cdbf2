#include "items/TBFileObjectIdentifier.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <climits>
#include <map>
#include <string>

#include "host/HostPorterManager.h"
#include "host/ItemIdentifier.h"
#include "host/PublishedTrees.h"
#include "host/UrlOperations.h"
#include "items/AppLibraryLookup.h"
#include "items/TBPFileObjectIdentifier.h"
#include "platform/FileSystem.h"
#include "platform/OpenFolder.h"
#include "platform/ScopedFd.h"
#include "platform/objects/Number.h"
#include "platform/strata/AttributeList.h"
#include "platform/strata/StrataService.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr int kEventOnlyFlags = O_PATH | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

// The descriptor of an open-for-events item, closed on every path out.
ScopedFd openEventOnly(const std::string& path) {
    return ScopedFd(FileSystem::current().open(path, kEventOnlyFlags));
}

// How the storage stands to `url`. An entry of a folder known to be inside (a listed one, or
// one checked for this page or batch) is contained when the storage is its ancestor by name: the
// storage was a folder on the way to it, which spares a status query of the storage per entry.
UrlRelationship relationshipOfStorage(const Url& storage, const Url& url) {
    const std::string& folder = storage.path();
    const std::string& path = url.path();
    if (path.size() > folder.size() + 1 && folder != "/" &&
        path.compare(0, folder.size(), folder) == 0 && path[folder.size()] == '/' &&
        PublishedTrees::knownInside(url))
        return UrlRelationship::Contains;
    return pt_relationshipToItemAtURL(storage, url);
}

std::string pathOrUnknown(const Url& url) {
    return url.path().empty() ? std::string("<Unknown File>") : url.path();
}

// The cached-or-read ID resource value: a number, nothing, or a read failure (logged).
enum class IdRead { Value, Absent, Failed };

IdRead readIdResource(const Url& url, ResourceKey key, const char* kind, uint64_t& value) {
    auto result = url.resourceValue(key);
    if (!result.ok()) {
        const Error& error = result.error();
        LogLevel level = error.is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile)
                             ? LogLevel::Info
                             : LogLevel::Error;
        logFormat(level, "can't get resource value for " + std::string(key) + "; %@",
                  {error.description()});
        return IdRead::Failed;
    }
    if (!result.value())
        return IdRead::Absent;
    auto number = objectCast<Number>(result.value());
    if (!number) {
        fatalError(formatPlatform(std::string("unexpected class for ") + kind +
                                      " (expected: HostNumber, actual: %@) at %@",
                                  {std::string(result.value()->className()), pathOrUnknown(url)}));
    }
    value = number->uint64Value();
    return IdRead::Value;
}

// The device of the document storage folder; 0 after logging why it has none.
bool isRetriedErrno(int error) {
    return error == EAGAIN || error == EBUSY || error == ESTALE;
}

}  // namespace

uint32_t TBFileObjectIdentifier::deviceIDWithError(const Url& url, Error* error) {
    // The device is all that is asked: one statx, no descriptor and no document-ID look-up
    // (every "did=" resolution asks it of the storage folder).
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, url.path(), AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) !=
        0) {
        int saved = errno;
        if (error)
            *error = Error::posix(saved);
        errno = saved;
        return 0;
    }
    return encodeDevice(st.stx_dev_major, st.stx_dev_minor);
}

uint32_t TBFileObjectIdentifier::storageDeviceID() {
    Url storage = HostPorterManager::defaultManager()->documentStorageURL();
    uint32_t device = deviceID(storage);
    if (device == 0) {
        logFormat(LogLevel::Error, "can't get device ID for \"%@\"; %{errno}d",
                  {storage.path(), ErrnoArg{errno}});
    }
    return device;
}

uint32_t TBFileObjectIdentifier::deviceID(const Url& url) {
    return deviceIDWithError(url, nullptr);
}

std::optional<HostPorterItemIdentifier> TBFileObjectIdentifier::itemIdentifier(const Url& url) {
    if (!url.isFileURL()) {
        logFormat(LogLevel::Error, "can't compute file object identifier if not a file URL", {});
        return std::nullopt;
    }
    // Reached through a link below a root: not an item of ours (outside the trees is logged
    // below).
    if (PublishedTrees::rootOf(url) && !PublishedTrees::check(url).ok()) {
        logFormat(LogLevel::Info, "can't compute file object identifier for \"%@\"; %@",
                  {url.path(), std::string(PublishedTrees::kOutsideMessage)});
        return std::nullopt;
    }
    Url storage = HostPorterManager::defaultManager()->documentStorageURL();
    switch (relationshipOfStorage(storage, url)) {
        case UrlRelationship::Same:
            return HostPorterRootContainerItemIdentifier;
        case UrlRelationship::Contains:
            break;
        case UrlRelationship::Other: {
            bool inLibrary = false;
            auto lookup = AppLibraryLookup::current();
            for (const Url& root :
                 lookup ? lookup->rootURLsForAppLibraries() : std::vector<Url>{}) {
                UrlRelationship r = pt_relationshipToItemAtURL(root, url);
                if (r == UrlRelationship::Contains) {
                    inLibrary = true;
                    break;
                }
                if (r == UrlRelationship::Same)
                    return TBPFileObjectIdentifier::fromAppLibraryDataContainerURL(root);
            }
            if (!inLibrary) {
                logFormat(LogLevel::Info,
                          "can't compute file object identifier because \"%@\" is not part of "
                          "Tamber",
                          {url.path()});
                return std::nullopt;
            }
            break;
        }
    }

    uint64_t cached = 0;
    bool folder = pt_isFolder(url);
    IdRead read = folder ? readIdResource(url, ResourceKeys::kFileID, "file ID", cached)
                         : readIdResource(url, ResourceKeys::kDocumentID, "doc ID", cached);
    if (read == IdRead::Failed)
        return std::nullopt;
    if (read == IdRead::Value) {
        return folder ? TBPFileObjectIdentifier::fromFileID(cached)
                      : TBPFileObjectIdentifier::fromDocumentID(cached);
    }

    auto package = url.resourceValue(ResourceKeys::kIsPackage);
    if (!package.ok()) {
        logFormat(LogLevel::Error, "can't get resource HostURLIsPackageKey for \"%@\"; %@",
                  {url.path(), package.error().description()});
        return std::nullopt;
    }
    auto packageNumber = objectCast<Number>(package.value());
    bool isPackage = packageNumber && packageNumber->boolValue();

    ScopedFd fd = openEventOnly(url.path());
    if (!fd.ok()) {
        logFormat(LogLevel::Error, "can't open file at \"%@\"; %{errno}d",
                  {url.path(), ErrnoArg{errno}});
        return std::nullopt;
    }
    CommonAttributes attributes;
    if (GetAttributeList(fd.get(), attributes) != 0) {
        logFormat(LogLevel::Error, "can't get attribute list for \"%@\"; %{errno}d",
                  {url.path(), ErrnoArg{errno}});
        return std::nullopt;
    }
    uint32_t type = attributes.mode & 0xF000;
    bool isDocument = type == 0x8000 || (type == 0x4000 && isPackage);
    if (!isDocument) {
        fd.reset();
        if (auto status =
                url.setResourceValue(Number::fromUInt64(attributes.fileId), ResourceKeys::kFileID);
            !status.ok()) {
            logFormat(LogLevel::Info,
                      "can't cache value %@ for key HostURLFileResourceIdentifierKey; %@",
                      {std::to_string(attributes.fileId), status.error().description()});
        }
        return TBPFileObjectIdentifier::fromFileID(attributes.fileId);
    }

    uint32_t documentId = attributes.documentId;
    if (documentId == 0)
        documentId = StrataLibraryGetOrAllocateDocumentId(fd.get());
    if (documentId == 0) {
        logFormat(LogLevel::Error, "can't get permanent storage for \"%@\"", {url.path()});
        return std::nullopt;
    }
    fd.reset();
    if (auto error =
            url.setResourceValue(Number::fromUInt64(documentId), ResourceKeys::kDocumentID);
        !error.ok()) {
        logFormat(LogLevel::Info, "can't cache value %@ for key HostURLDocumentIdentifierKey; %@",
                  {std::to_string(documentId), error.error().description()});
    }
    return TBPFileObjectIdentifier::fromDocumentID(documentId);
}

namespace {

// Whether the entries of the folder at `folder` are inside a published tree, as itemIdentifier
// decides it for each: below the storage folder, or below an app library's root.
bool entriesAreInsideTrees(const Url& folder) {
    Url storage = HostPorterManager::defaultManager()->documentStorageURL();
    UrlRelationship relation = pt_relationshipToItemAtURL(storage, folder);
    if (relation != UrlRelationship::Other)
        return true;
    auto lookup = AppLibraryLookup::current();
    for (const Url& root : lookup ? lookup->rootURLsForAppLibraries() : std::vector<Url>{}) {
        if (pt_relationshipToItemAtURL(root, folder) != UrlRelationship::Other)
            return true;
    }
    return false;
}

// The number `key` of `url`, false when it can't be read or has none.
bool numberValue(const Url& url, ResourceKey key, uint64_t& value) {
    auto read = url.resourceValue(key);
    auto number = read.ok() ? objectCast<Number>(read.value()) : nullptr;
    if (!number)
        return false;
    value = number->uint64Value();
    return true;
}

bool boolValue(const Url& url, ResourceKey key, bool& value) {
    auto read = url.resourceValue(key);
    if (!read.ok())
        return false;
    auto number = objectCast<Number>(read.value());
    value = number && number->boolValue();
    return true;
}

}  // namespace

void TBFileObjectIdentifier::prepareItemIdentifiers(const std::vector<Url>& urls) {
    auto service = StrataService::current();
    if (!service || urls.empty())
        return;
    // The entries of a page share their folder: it is placed once.
    std::map<std::string, bool> insideByFolder;
    std::vector<StrataService::FileName> documents;
    std::vector<const Url*> documentUrls;
    // A listing's URLs keep their open folder: each file is then found by its name alone.
    std::vector<OpenFolderRef> folders;
    for (const Url& url : urls) {
        if (!url.isFileURL() || url.path() == "/")
            continue;
        Url folder = url.deletingLastPathComponent();
        auto inside = insideByFolder.find(folder.path());
        if (inside == insideByFolder.end())
            inside = insideByFolder.emplace(folder.path(), entriesAreInsideTrees(folder)).first;
        if (!inside->second)
            continue;
        // What a listing prefetched: no call to the file system for these.
        bool isDirectory = false;
        bool isPackage = false;
        if (!boolValue(url, ResourceKeys::kIsDirectory, isDirectory) ||
            (isDirectory && !boolValue(url, ResourceKeys::kIsPackage, isPackage)))
            continue;
        if (isDirectory && !isPackage) {
            (void)url.resourceValue(ResourceKeys::kFileID);  // read once, kept in the cache
            continue;
        }
        if (OpenFolderRef open = url.openFolder()) {
            StrataService::FileName file{open->fd(), url.lastPathComponent()};
            // A listing read the entry's identity with the rest of its status: the service needs
            // no status query of its own.
            uint64_t inode = 0;
            uint64_t volume = 0;
            bool regular = false;
            if (numberValue(url, ResourceKeys::kFileID, inode) &&
                numberValue(url, ResourceKeys::kVolumeIdentifier, volume) &&
                boolValue(url, ResourceKeys::kIsRegularFile, regular)) {
                if (!regular && !isDirectory)
                    continue;  // a link or a special file: never a document
                file.known = true;
                file.device = encodeDevice(major(volume), minor(volume));
                file.inode = inode;
                file.regular = regular;
            }
            documents.push_back(std::move(file));
            folders.push_back(std::move(open));
        } else {
            // The service checks the type (a regular file or a folder, never a link).
            documents.push_back({AT_FDCWD, url.path()});
        }
        documentUrls.push_back(&url);
    }
    if (documents.empty())
        return;
    std::vector<uint32_t> ids = service->getOrAllocateDocumentIds(documents);
    for (size_t i = 0; i < ids.size() && i < documentUrls.size(); ++i) {
        if (ids[i] != 0) {
            (void)documentUrls[i]->setResourceValue(Number::fromUInt64(ids[i]),
                                                    ResourceKeys::kDocumentID);
        }
    }
}

std::optional<Url> TBFileObjectIdentifier::fileURLWithItemIdentifier(
    const HostPorterItemIdentifier& identifier) {
    if (identifier == HostPorterRootContainerItemIdentifier)
        return HostPorterManager::defaultManager()->documentStorageURL();

    std::vector<std::string> components;
    size_t start = 0;
    while (true) {
        size_t eq = identifier.find('=', start);
        components.push_back(identifier.substr(start, eq - start));
        if (eq == std::string::npos)
            break;
        start = eq + 1;
    }
    if (components.size() != 2) {
        logFormat(LogLevel::Error,
                  "invalid identifier; identifier should have 2 components, not %lu",
                  {uint64_t(components.size())});
        return std::nullopt;
    }
    const std::string& host = components[0];
    if (host != "did" && host != "fid") {
        logFormat(LogLevel::Error, "invalid host for identifier \"%@\"", {identifier});
        return std::nullopt;
    }
    uint32_t device = storageDeviceID();
    if (device == 0)
        return std::nullopt;
    // Trailing text ("1x", "1\n2") makes it no number (0): it must not name the item of its
    // prefix.
    uint64_t value = ItemIdentifier::parse(identifier).number();
    uint64_t fileId = value;
    if (host == "did") {
        // Document IDs are 32-bit; a larger number names no document.
        uint32_t documentId = value > UINT32_MAX ? 0 : static_cast<uint32_t>(value);
        fileId = StrataLibraryResolveDocumentId2(device, documentId);
        for (int retry = 0; fileId == 0; ++retry) {
            int error = errno;
            if (!isRetriedErrno(error)) {
                logFormat(LogLevel::Error, "can't resolve doc ID \"%lld\"; %{errno}d",
                          {int64_t(value), ErrnoArg{error}});
                return std::nullopt;
            }
            if (retry == kResolutionRetries) {
                logFormat(LogLevel::Info, "can't resolve doc ID \"%lld\" after five attempts",
                          {int64_t(value)});
                return std::nullopt;
            }
            logFormat(LogLevel::Info,
                      "doc ID resolution failed with errno(%d), let's try again after resting",
                      {int64_t(error)});
            ::usleep(kRetryRestMicroseconds);
            fileId = StrataLibraryResolveDocumentId2(device, documentId);
        }
    }
    return _fileURLWithFileIdentifier(fileId, device);
}

std::optional<Url> TBFileObjectIdentifier::fileURLWithFileIdentifier(uint64_t fileID) {
    uint32_t device = storageDeviceID();
    if (device == 0)
        return std::nullopt;
    return _fileURLWithFileIdentifier(fileID, device);
}

std::optional<Url> TBFileObjectIdentifier::_fileURLWithFileIdentifier(uint64_t fileID,
                                                                      uint32_t deviceID) {
    char buffer[1024];
    if (PathFromFileID(deviceID, fileID, buffer, sizeof buffer) != 0) {
        logFormat(LogLevel::Info, "can't resolve path matching file ID \"%lld\"; %{errno}d",
                  {int64_t(fileID), ErrnoArg{errno}});
        return std::nullopt;
    }
    Url url = Url::fileURLWithPath(buffer);
    // The journal may remember trees no longer published, and a path that now runs through a
    // link: neither names an item.
    if (auto outside = PublishedTrees::check(url); !outside.ok()) {
        logFormat(LogLevel::Info, "file ID \"%lld\" resolves to \"%@\"; %@",
                  {int64_t(fileID), url.path(), std::string(PublishedTrees::kOutsideMessage)});
        return std::nullopt;
    }
    return url;
}

}  // namespace tamber
