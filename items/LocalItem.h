#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "host/HostPorterItem.h"
#include "host/HostPorterItemIdentifier.h"
#include "platform/Url.h"
#include "platform/objects/Data.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber {

// What a caller may impose instead of what the file says. Lookups pass nothing; app libraries
// pass their own identifier, the root as parent, the app's name and its bundle identifier.
struct LocalItemOptions {
    // Every member has a default, so that callers name only what they set.
    std::optional<HostPorterItemIdentifier> customItemID{};
    std::optional<HostPorterItemIdentifier> customParentItemID{};
    std::optional<std::string> customFilename{};
    // Look the URL up among the app-library roots and record the library that contains it.
    bool hasBeaconDomainIdentifier = false;
    std::optional<std::string> bundleIdentifier{};
};

// The record handed to the host for every file and folder: a snapshot of one URL's identity,
// name, type, size, dates, capabilities and user metadata, taken when it is built. Records are
// built fresh for every request and shared as `std::shared_ptr<const LocalItem>`.
class LocalItem : public HostPorterItem {
public:
    // Names of the extended attributes that hold each item's user metadata.
    static const std::string& xattrLastUsedDateName();
    static const std::string& xattrTagDataName();
    static const std::string& xattrFavoriteRankName();
    static const std::string& xattrTrashDateName();
    static const std::string& xattrTrashPutBackName();

    // The resource keys enumerators prefetch so that building a record reads no value twice:
    // parent directory URL, name, localized name, type identifier, file size, creation date,
    // content modification date, is readable, is writable.
    static const std::vector<ResourceKey>& urlKeys();
    // urlKeys and the keys the record's identifier needs (is directory, is package, file ID,
    // volume, is regular file):
    // what a listing prefetches, all from the same status query.
    static const std::vector<ResourceKey>& listingKeys();

    // The identifier of the folder that holds `url`, as make() finds it: a listing that builds
    // many records in one folder asks once and passes it as customParentItemID.
    static std::optional<HostPorterItemIdentifier> parentItemIdentifierOf(const Url& url);

    // The record of the item at `url`, or null (after one log line) when it has no identifier,
    // parent, name or type, or is a hidden "Inbox" folder.
    static std::shared_ptr<const LocalItem> make(const Url& url,
                                                 const LocalItemOptions& options = {});
    // The record of the item with this file ID on the document storage volume, or null.
    static std::shared_ptr<const LocalItem> makeWithFileIdentifier(uint64_t fileID);

    // Host item properties.
    HostPorterItemIdentifier itemIdentifier() const override { return fields_.itemIdentifier; }
    HostPorterItemIdentifier parentItemIdentifier() const override {
        return fields_.parentItemIdentifier;
    }
    std::string filename() const override { return fields_.filename; }
    std::string typeIdentifier() const override { return fields_.typeIdentifier; }
    HostPorterItemCapabilities capabilities() const override { return fields_.capabilities; }
    std::shared_ptr<const Number> documentSize() const override { return fields_.documentSize; }
    std::shared_ptr<const Number> childItemCount() const override { return fields_.childItemCount; }
    std::shared_ptr<const Date> creationDate() const override { return fields_.creationDate; }
    std::shared_ptr<const Date> contentModificationDate() const override {
        return fields_.contentModificationDate;
    }
    std::shared_ptr<const Date> lastUsedDate() const override { return fields_.lastUsedDate; }
    std::optional<Bytes> tagData() const override { return fields_.tagData; }
    std::shared_ptr<const Number> favoriteRank() const override { return fields_.favoriteRank; }
    bool isTrashed() const override { return fields_.isTrashed; }
    std::optional<Bytes> versionIdentifier() const override { return fields_.versionIdentifier; }
    // "<LocalItem:0x... did=5 name:"a" parent:root type:public.data trashed favorite:3>"
    std::string description() const override;

    std::optional<uint64_t> fileID() const { return fields_.fileID; }
    std::optional<uint64_t> docID() const { return fields_.docID; }
    const Url& fileURL() const { return fields_.fileURL; }
    const std::optional<std::string>& pt_appContainerBundleIdentifier() const {
        return fields_.appContainerBundleIdentifier;
    }
    bool isFolder() const;
    bool isPackage() const;

    // Only the builder of a record changes its count, before handing the record out.
    void setChildItemCount(std::shared_ptr<const Number> count) {
        fields_.childItemCount = std::move(count);
    }

    // Where a trashed item returns to. Computed by the installed resolver when first asked (and
    // kept), unless set before. Safe to call on a shared record from any thread.
    std::optional<Url> putBackURL() const;
    void setPutBackURL(std::optional<Url> url) const;
    // Resolving a put-back location needs the app libraries' base paths, which live above this
    // layer; the trash code installs the resolver. Without one, records have no location until
    // one is set. Returns the previous resolver.
    using PutBackResolver = std::function<std::optional<Url>(const LocalItem& item)>;
    static PutBackResolver setPutBackResolver(PutBackResolver resolver);

protected:
    // Every stored field, as the designated constructor fills them.
    struct Fields {
        HostPorterItemIdentifier itemIdentifier;
        HostPorterItemIdentifier parentItemIdentifier;
        std::string filename;
        std::string typeIdentifier;
        std::shared_ptr<const Number> documentSize;
        std::shared_ptr<const Date> creationDate;
        std::shared_ptr<const Date> contentModificationDate;
        std::shared_ptr<const Number> childItemCount;
        HostPorterItemCapabilities capabilities = 0;
        std::optional<Bytes> versionIdentifier;
        bool isTrashed = false;
        std::shared_ptr<const Date> lastUsedDate;
        std::optional<Bytes> tagData;
        std::shared_ptr<const Number> favoriteRank;
        std::optional<uint64_t> fileID;
        std::optional<uint64_t> docID;
        Url fileURL;
        std::optional<std::string> beaconDomainIdentifier;
        std::optional<std::string> appContainerBundleIdentifier;
    };

    // Runs the designated constructor's checks and reads; nothing (after one log line) when
    // the record can't be built.
    static std::optional<Fields> buildFields(const Url& url, const LocalItemOptions& options);
    explicit LocalItem(Fields fields);

    // The class name that `description` shows.
    virtual const char* className() const { return "LocalItem"; }

private:
    Fields fields_;

    mutable std::mutex putBackMutex_;
    mutable bool putBackResolved_ = false;
    mutable std::optional<Url> putBackURL_;
};

using LocalItemRef = std::shared_ptr<const LocalItem>;

}  // namespace tamber
