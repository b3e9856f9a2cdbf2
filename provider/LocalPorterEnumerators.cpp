#include <cerrno>

#include "enumeration/LocalFileEnumerator.h"
#include "enumeration/LocalRootEnumerator.h"
#include "host/PublishedTrees.h"
#include "platform/FileSystem.h"
#include "platform/objects/Number.h"
#include "provider/LocalPorter.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

Result<HostPorterEnumeratorRef> LocalPorter::enumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& identifier) {
    return withLogSection("enumerator for " + identifier, [&]() -> Result<HostPorterEnumeratorRef> {
        if (identifier == HostPorterRootContainerItemIdentifier ||
            identifier == HostPorterWorkingSetContainerItemIdentifier ||
            identifier == HostPorterAllDirectoriesContainerItemIdentifier) {
            // Served from the app libraries and every published tree; no lookup needed.
            auto root = LocalRootEnumerator::initWithContainer(identifier);
            root->start();
            return HostPorterEnumeratorRef(root);
        }
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok())
            return url.error();
        // A link is an item, not a container: listing it would read what lies behind it.
        if (auto opened = PublishedTrees::openFolder(url.value(), O_PATH); opened.ok())
            services_.fileSystem->close(opened.value());
        else if (PublishedTrees::isOutsideError(opened.error()))
            return opened.error();
        // A file has no children: listing one would answer with an empty page, which a caller
        // can't tell from an empty folder. What can't be read here is left to the listing,
        // which reports it.
        if (auto isDirectory = url.value().resourceValue(ResourceKeys::kIsDirectory);
            isDirectory.ok()) {
            auto flag = objectCast<Number>(isDirectory.value());
            if (flag && !flag->boolValue()) {
                logError("can't enumerate " + identifier + "; it is not a folder");
                return Error(
                    kPosixErrorDomain, ENOTDIR,
                    {{"description", "not a folder: " + identifier + " (a file can't be listed)"}});
            }
        }
        auto enumerator = LocalFileEnumerator::initWithContainer(identifier, {url.value()});
        enumerator->start();
        return HostPorterEnumeratorRef(enumerator);
    });
}

}  // namespace tamber
