#include "items/LocalAppLibraryItem.h"

#include <string_view>

#include "platform/FileSystem.h"
#include "support/Log.h"

namespace tamber {

namespace {

// Whether the entry `name` of `library` is one that listings leave out of the library: its
// ".Trash" (whatever it is), and "Inbox" when it is a folder (a plain file of that name is
// listed like any other). The count holds every entry, so only what is left out comes off.
bool isLeftOutOfListing(const Url& library, const char* name) {
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, library.appendingPathComponent(name).path(),
                                    AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) != 0) {
        return false;
    }
    return std::string_view(name) == ".Trash" || S_ISDIR(st.stx_mode);
}

}  // namespace

HostPorterItemIdentifier appLibraryIdentifier(const BundleRecord& record) {
    return "#" + record.bundleIdentifier().value_or("(null)");
}

std::shared_ptr<const LocalAppLibraryItem> LocalAppLibraryItem::initFrom(
    const BundleRecordRef& record) {
    const std::optional<Url> container = record ? record->dataContainerURL() : std::nullopt;
    if (!container) {
        logError("can't create an app library item without a data container URL");
        return nullptr;
    }
    Url url = container->appendingPathComponent("Documents");

    LocalItemOptions options;
    options.customItemID = appLibraryIdentifier(*record);
    options.customParentItemID = HostPorterRootContainerItemIdentifier;
    options.customFilename = record->localizedName();
    options.hasBeaconDomainIdentifier = false;
    options.bundleIdentifier = record->bundleIdentifier();
    std::optional<Fields> fields = buildFields(url, options);
    if (!fields)
        return nullptr;
    std::shared_ptr<LocalAppLibraryItem> item(new LocalAppLibraryItem(std::move(*fields)));

    // Listings leave these two out of a library; so does its count.
    if (auto count = item->childItemCount()) {
        uint64_t children = count->uint64Value();
        for (const char* hidden : {"Inbox", ".Trash"}) {
            if (!isLeftOutOfListing(url, hidden))
                continue;
            if (children == 0) {
                fatalError("child item count of " + url.path() + " would drop below 0 for \"" +
                           hidden + "\"");
            }
            --children;
            item->setChildItemCount(Number::fromUInt64(children));
        }
    }
    return item;
}

std::shared_ptr<const LocalAppLibraryItem> LocalAppLibraryItem::make(const Url& url,
                                                                     const LocalItemOptions&) {
    fatalError("LocalAppLibraryItem is made from a bundle record (initFrom), not from " +
               url.path());
}

}  // namespace tamber
