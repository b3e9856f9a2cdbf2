#include "enumeration/LocalFileEnumerator.h"
#include "enumeration/LocalRootEnumerator.h"
#include "host/PublishedTrees.h"
#include "platform/FileSystem.h"
#include "provider/LocalPorter.h"
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
            FileSystem::current().close(opened.value());
        else if (PublishedTrees::isOutsideError(opened.error()))
            return opened.error();
        auto enumerator = LocalFileEnumerator::initWithContainer(identifier, {url.value()});
        enumerator->start();
        return HostPorterEnumeratorRef(enumerator);
    });
}

}  // namespace tamber
