#include "items/LocalItem.h"

#include <algorithm>
#include <atomic>
#include <bit>
#include <cerrno>
#include <charconv>
#include <cstdio>

#include "host/ItemIdentifier.h"
#include "host/UrlOperations.h"
#include "items/AppLibraryLookup.h"
#include "items/FolderEntryCounts.h"
#include "items/ItemMetadata.h"
#include "items/ResourceValueGetter.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/FileSystem.h"
#include "platform/OpenFolder.h"
#include "platform/ScopedFd.h"
#include "platform/TypeIdentifiers.h"
#include "platform/objects/String.h"
#include "support/Error.h"
#include "support/Log.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

namespace K = ResourceKeys;

// Everything the constructor reads from the file, fetched with one statx when the caller has
// not prefetched it. The identity keys serve the identifier look-up; a caller that brings its
// own identifier doesn't need them.
const std::vector<ResourceKey>& recordKeys(bool withIdentity) {
    static const std::vector<ResourceKey> kRecord = {
        K::kName,         K::kTypeIdentifier,          K::kFileSize,
        K::kCreationDate, K::kContentModificationDate, K::kIsWritable,
    };
    static const std::vector<ResourceKey> kWithIdentity = [] {
        std::vector<ResourceKey> keys = kRecord;
        keys.insert(keys.end(), {K::kIsDirectory, K::kIsPackage, K::kFileID});
        return keys;
    }();
    return withIdentity ? kWithIdentity : kRecord;
}

// The identifier of the folder holding an item: what it needs in one statx instead of three.
std::optional<HostPorterItemIdentifier> parentIdentifierOf(const Url& url) {
    static const std::vector<ResourceKey> kIdentity = {K::kIsDirectory, K::kIsPackage, K::kFileID};
    Url parent = url.deletingLastPathComponent();
    // A failed prefetch leaves the reads below to find (and log) the failure themselves.
    (void)parent.prefetchResourceValues(kIdentity);
    return TBFileObjectIdentifier::itemIdentifier(parent);
}

bool isFolderType(std::string_view type) {
    return TypeConforms(type, TypeIdentifiers::kFolder);
}

bool isPackageType(std::string_view type) {
    return TypeConforms(type, TypeIdentifiers::kPackage);
}

// Packages of these families are documents whose size the user cares about; other packages
// would cost a walk for nothing.
bool isSizedPackageType(std::string_view type) {
    return type.starts_with("com.velk.lumen") || type.starts_with("com.velk.resona");
}

// Whether the item lies inside its library's trash: the folder ".Trash" directly below the
// first "Documents" component of its path. Decided by the path alone, so that an item trashed
// without its trash date (the date is written after the move, and may fail) still counts.
bool isInTrashFolder(const Url& url) {
    std::string_view path = url.path();
    for (size_t start = 1; start < path.size();) {
        size_t end = std::min(path.find('/', start), path.size());
        if (path.substr(start, end - start) == "Documents") {
            // ".Trash" next, and something inside it.
            std::string_view rest = path.substr(std::min(end + 1, path.size()));
            return rest.starts_with(".Trash/") && rest.size() > 7;
        }
        start = end + 1;
    }
    return false;
}

// The bits of the modification time, little-endian: any change of the date changes them.
Bytes versionFromDate(const Date& date) {
    uint64_t bits = std::bit_cast<uint64_t>(date.timeIntervalSince1970());
    Bytes bytes(sizeof bits);
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<uint8_t>(bits >> (8 * i));
    return bytes;
}

std::optional<uint64_t> documentIDOf(const HostPorterItemIdentifier& identifier) {
    auto parsed = ItemIdentifier::parse(identifier);
    if (parsed.kind() != ItemIdentifier::Kind::Document)
        return std::nullopt;
    return parsed.number();
}

HostPorterItemCapabilities capabilitiesFor(const Url& url, const HostPorterItemIdentifier& id) {
    namespace C = HostPorterItemCapability;
    if (id == HostPorterRootContainerItemIdentifier)
        return C::kReading;
    HostPorterItemCapabilities capabilities = C::kReading;
    auto writable = ResourceValueGetter<Number>(url, K::kIsWritable);
    if (writable && writable->boolValue()) {
        capabilities |= C::kWriting;
        // App libraries are the apps' own: they can be written into, never moved or removed.
        if (!ItemIdentifier::parse(id).isAppLibrary())
            capabilities |= C::kReparenting | C::kRenaming | C::kTrashing | C::kDeleting;
    }
    return capabilities;
}

std::shared_ptr<const Number> documentSizeFor(const Url& url, const std::string& type) {
    if (isPackageType(type)) {
        if (!isSizedPackageType(type))
            return nullptr;
        auto size = pt_directorySizeWithError(url);
        return size.ok() ? Number::fromUInt64(size.value()) : nullptr;
    }
    if (isFolderType(type))
        return nullptr;
    return ResourceValueGetter<Number>(url, K::kFileSize);
}

struct StatusFields {
    std::optional<uint64_t> fileID;
    std::shared_ptr<const Number> childItemCount;
};

// The number of entries of a folder, hidden ones included. Linux counts only sub-folders in a
// folder's link count (and btrfs always says 1), so the count that other systems read from the
// link count is read from the folder itself here. Nothing when it can't be read.
std::shared_ptr<const Number> countEntries(const Url& url) {
    std::optional<uint64_t> count = FolderEntryCounts::shared().count(url.path());
    if (!count)
        return nullptr;
    // A 16-bit count, as the host's is; a larger folder says the most it can.
    return Number::fromUInt64(std::min<uint64_t>(*count, UINT16_MAX));
}

// The status query: the inode number, and for folders the number of children. A URL made in a
// folder that a listing holds open is asked relative to it.
StatusFields readStatus(const Url& url, const std::string& type) {
    FileSystem& fs = FileSystem::current();
    const OpenFolderRef folder = url.openFolder();
    struct statx st {};
    const int failed =
        folder ? fs.statx(folder->fd(), url.lastPathComponent(), AT_SYMLINK_NOFOLLOW,
                          STATX_TYPE | STATX_INO, &st)
               : fs.statx(AT_FDCWD, url.path(), AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_INO, &st);
    if (failed != 0) {
        Error error = Error::errorWithPOSIXCode(errno);
        auto message = [&] {
            return "can't find fileID for item \"" + url.path() + "\"; " + error.description();
        };
        if (error.code() == ENOENT) {
            logDebug(message);
        } else {
            logError(message());
        }
        return {};
    }
    StatusFields status{st.stx_ino, nullptr};
    if (isFolderType(type) && S_ISDIR(st.stx_mode))
        status.childItemCount = countEntries(url);
    return status;
}

std::shared_ptr<LocalItem::PutBackResolver>& putBackResolverSlot() {
    static ProcessWide<std::shared_ptr<LocalItem::PutBackResolver>> resolver;
    return *resolver;
}

}  // namespace

// Function-local statics: initialised once, on first use, thread-safely.
const std::string& LocalItem::xattrLastUsedDateName() {
    static const std::string name = "com.velk.lastuseddate#PS";
    return name;
}

const std::string& LocalItem::xattrTagDataName() {
    static const std::string name = "com.velk.metadata:_kHostItemUserTags";
    return name;
}

const std::string& LocalItem::xattrFavoriteRankName() {
    static const std::string name = "com.velk.favorite-rank.number#PS";
    return name;
}

const std::string& LocalItem::xattrTrashDateName() {
    static const std::string name = "com.velk.trash.time#PS";
    return name;
}

const std::string& LocalItem::xattrTrashPutBackName() {
    static const std::string name = "com.velk.trash.putback#PS";
    return name;
}

const std::vector<ResourceKey>& LocalItem::urlKeys() {
    static const std::vector<ResourceKey> keys = {
        K::kParentDirectoryURL,      K::kName,       K::kLocalizedName,
        K::kTypeIdentifier,          K::kFileSize,   K::kCreationDate,
        K::kContentModificationDate, K::kIsReadable, K::kIsWritable,
    };
    return keys;
}

const std::vector<ResourceKey>& LocalItem::listingKeys() {
    static const std::vector<ResourceKey> keys = [] {
        std::vector<ResourceKey> all = urlKeys();
        all.insert(all.end(), {K::kIsDirectory, K::kIsPackage, K::kFileID, K::kVolumeIdentifier,
                               K::kIsRegularFile});
        return all;
    }();
    return keys;
}

std::optional<HostPorterItemIdentifier> LocalItem::parentItemIdentifierOf(const Url& url) {
    return parentIdentifierOf(url);
}

LocalItem::LocalItem(Fields fields) : fields_(std::move(fields)) {}

std::optional<LocalItem::Fields> LocalItem::buildFields(const Url& url,
                                                        const LocalItemOptions& options) {
    // A failed prefetch leaves the reads below to find (and log) the failure themselves.
    (void)url.prefetchResourceValues(recordKeys(!options.customItemID));
    Fields f;

    std::optional<HostPorterItemIdentifier> id =
        options.customItemID ? options.customItemID : TBFileObjectIdentifier::itemIdentifier(url);
    if (!id) {
        logDebug("can't create an item without an ID");
        return std::nullopt;
    }
    f.itemIdentifier = std::move(*id);

    std::optional<HostPorterItemIdentifier> parent;
    if (f.itemIdentifier == HostPorterRootContainerItemIdentifier) {
        parent = HostPorterRootContainerItemIdentifier;
    } else if (options.customParentItemID) {
        parent = options.customParentItemID;
    } else {
        parent = parentIdentifierOf(url);
    }
    if (!parent) {
        logError("can't create an item without a parent ID (itemIdentifier: " + f.itemIdentifier +
                 ")");
        return std::nullopt;
    }
    f.parentItemIdentifier = std::move(*parent);

    if (options.customFilename) {
        f.filename = *options.customFilename;
    } else if (auto name = ResourceValueGetter<String>(url, K::kName)) {
        f.filename = name->value();
    } else {
        logError("can't create an item without a filename (itemIdentifier: " + f.itemIdentifier +
                 ", parentItemIdentifier: " + f.parentItemIdentifier + ")");
        return std::nullopt;
    }

    auto type = ResourceValueGetter<String>(url, K::kTypeIdentifier);
    if (!type) {
        logError("can't create an item without a type identifier (itemIdentifier: " +
                 f.itemIdentifier + ", parentItemIdentifier: " + f.parentItemIdentifier +
                 ", filename: " + f.filename + ")");
        return std::nullopt;
    }
    f.typeIdentifier = type->value();

    // The folders into which other apps drop files are the system's, not the user's.
    if (f.filename == "Inbox" && isFolderType(f.typeIdentifier) &&
        (f.parentItemIdentifier == HostPorterRootContainerItemIdentifier ||
         ItemIdentifier::parse(f.parentItemIdentifier).isAppLibrary())) {
        logDebug("can't create an item for the \"Inbox\" directory");
        return std::nullopt;
    }

    f.documentSize = documentSizeFor(url, f.typeIdentifier);
    f.creationDate = ResourceValueGetter<Date>(url, K::kCreationDate);
    f.contentModificationDate = ResourceValueGetter<Date>(url, K::kContentModificationDate);
    f.capabilities = capabilitiesFor(url, f.itemIdentifier);
    if (f.contentModificationDate)
        f.versionIdentifier = versionFromDate(*f.contentModificationDate);

    StatusFields status = readStatus(url, f.typeIdentifier);
    f.fileID = status.fileID;
    f.childItemCount = std::move(status.childItemCount);

    f.docID = documentIDOf(f.itemIdentifier);
    f.fileURL = url;
    f.appContainerBundleIdentifier = options.bundleIdentifier;
    if (options.hasBeaconDomainIdentifier) {
        auto lookup = AppLibraryLookup::current();
        if (auto bundle = lookup ? lookup->bundleIdentifierForRoot(url, UrlRelationship::Contains)
                                 : std::nullopt) {
            f.appContainerBundleIdentifier = *bundle;
            f.beaconDomainIdentifier = *bundle;
        }
    }

    ItemMetadata metadata = ItemMetadata::read(url);
    f.lastUsedDate = std::move(metadata.lastUsedDate);
    f.tagData = std::move(metadata.tagData);
    f.favoriteRank = std::move(metadata.favoriteRank);
    f.isTrashed = isInTrashFolder(url);
    return f;
}

std::shared_ptr<const LocalItem> LocalItem::make(const Url& url, const LocalItemOptions& options) {
    std::optional<Fields> fields = buildFields(url, options);
    if (!fields)
        return nullptr;
    return std::shared_ptr<const LocalItem>(new LocalItem(std::move(*fields)));
}

std::shared_ptr<const LocalItem> LocalItem::makeWithFileIdentifier(uint64_t fileID) {
    std::optional<Url> url = TBFileObjectIdentifier::fileURLWithFileIdentifier(fileID);
    if (!url)
        return nullptr;
    return make(*url);
}

bool LocalItem::isFolder() const {
    return isFolderType(fields_.typeIdentifier);
}

bool LocalItem::isPackage() const {
    return isPackageType(fields_.typeIdentifier);
}

std::string LocalItem::description() const {
    char address[32];
    std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    std::string text;
    text.reserve(96 + fields_.itemIdentifier.size() + fields_.filename.size() +
                 fields_.parentItemIdentifier.size() + fields_.typeIdentifier.size());
    text.append("<").append(className()).append(":").append(address);
    text.append(" ").append(fields_.itemIdentifier);
    text.append(" name:\"").append(fields_.filename).append("\"");
    if (fields_.parentItemIdentifier == HostPorterRootContainerItemIdentifier) {
        text.append(" parent:root");
    } else {
        text.append(" parent:").append(fields_.parentItemIdentifier);
    }
    text.append(" type:").append(fields_.typeIdentifier);
    if (fields_.isTrashed)
        text.append(" trashed");
    if (fields_.favoriteRank)
        text.append(" favorite:").append(fields_.favoriteRank->description());
    text.append(">");
    return text;
}

std::optional<Url> LocalItem::putBackURL() const {
    {
        std::lock_guard lock(putBackMutex_);
        if (putBackResolved_)
            return putBackURL_;
    }
    // Resolved outside the lock: the resolver reads attributes and asks the app libraries.
    auto resolver = std::atomic_load(&putBackResolverSlot());
    std::optional<Url> resolved = resolver && *resolver ? (*resolver)(*this) : std::nullopt;
    std::lock_guard lock(putBackMutex_);
    if (!putBackResolved_) {
        putBackURL_ = std::move(resolved);
        putBackResolved_ = true;
    }
    return putBackURL_;
}

void LocalItem::setPutBackURL(std::optional<Url> url) const {
    std::lock_guard lock(putBackMutex_);
    putBackURL_ = std::move(url);
    putBackResolved_ = true;
}

LocalItem::PutBackResolver LocalItem::setPutBackResolver(PutBackResolver resolver) {
    auto next = resolver ? std::make_shared<PutBackResolver>(std::move(resolver)) : nullptr;
    auto previous = std::atomic_exchange(&putBackResolverSlot(), std::move(next));
    return previous ? *previous : PutBackResolver();
}

}  // namespace tamber
