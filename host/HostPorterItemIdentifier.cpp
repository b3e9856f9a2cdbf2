#include "host/HostPorterItemIdentifier.h"

namespace tamber {

bool isHostContainerIdentifier(const HostPorterItemIdentifier& identifier) {
    return identifier == HostPorterRootContainerItemIdentifier ||
           identifier == HostPorterWorkingSetContainerItemIdentifier ||
           identifier == HostPorterAllDirectoriesContainerItemIdentifier ||
           identifier == HostPorterTemporaryLocalFolderItemIdentifier;
}

}  // namespace tamber
