#include "items/LocalAppLibraryItem.h"
#include "platform/apps/BundleRecord.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

void LocalPorter::_defaultApplicationContainerForBundleIdentifier(
    const std::string& bundleIdentifier, ItemCompletion completion) {
    withLogSection("default location for " + bundleIdentifier, [&] {
        auto record = BundleRecord::bundleRecordWithBundleIdentifier(bundleIdentifier);
        if (!record) {
            logError("can't create bundle proxy with '" + bundleIdentifier + "'");
            return completion(Error::invalidParameter("bundleIdentifier"));
        }
        // An installed app without a data container has no library to show.
        auto item = LocalAppLibraryItem::initFrom(record);
        if (!item) {
            logError("can't create an app library item with " + record->description());
            return completion(Error::invalidParameter("bundleIdentifier"));
        }
        completion(LocalItemRef(item));
    });
}

void LocalPorter::defaultApplicationContainerForBundleIdentifier(
    const std::string& bundleIdentifier, ItemCompletion completion) {
    _defaultApplicationContainerForBundleIdentifier(bundleIdentifier, std::move(completion));
}

}  // namespace tamber
