#pragma once

#include <memory>

#include "items/LocalItem.h"
#include "platform/apps/BundleRecord.h"

namespace tamber {

// "#" followed by the record's bundle identifier ("#(null)" when it has none): the item
// identifier of the record's app library.
HostPorterItemIdentifier appLibraryIdentifier(const BundleRecord& record);

// The record of one app library: the "Documents" folder of an app's data container, shown
// under the root, named after the app and carrying its bundle identifier.
class LocalAppLibraryItem : public LocalItem {
public:
    // The item of `record`'s library, or null: without a data container (one error line), or
    // when the folder can't be read as an item. Its child count leaves out "Inbox" and
    // ".Trash", which listings hide.
    static std::shared_ptr<const LocalAppLibraryItem> initFrom(const BundleRecordRef& record);

    // Library items come from bundle records only: calling this stops the process.
    [[noreturn]] static std::shared_ptr<const LocalAppLibraryItem> make(
        const Url& url, const LocalItemOptions& options = {});

protected:
    explicit LocalAppLibraryItem(Fields fields) : LocalItem(std::move(fields)) {}
    const char* className() const override { return "LocalAppLibraryItem"; }
};

using LocalAppLibraryItemRef = std::shared_ptr<const LocalAppLibraryItem>;

}  // namespace tamber
