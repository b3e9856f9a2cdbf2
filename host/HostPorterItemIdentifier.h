#pragma once

#include <string>

namespace tamber {

// The string identifier of an item: "fid=%lu", "did=%lu", "#" + bundle identifier, or one of
// the container identifiers below.
using HostPorterItemIdentifier = std::string;

// The fixed container identifiers. None contains "=" or "#", so they never collide with the
// file, document and app-library forms.
inline const HostPorterItemIdentifier HostPorterRootContainerItemIdentifier =
    "HostPorterRootContainerItemIdentifier";
inline const HostPorterItemIdentifier HostPorterWorkingSetContainerItemIdentifier =
    "HostPorterWorkingSetContainerItemIdentifier";
inline const HostPorterItemIdentifier HostPorterAllDirectoriesContainerItemIdentifier =
    "HostPorterAllDirectoriesContainerItemIdentifier";
inline const HostPorterItemIdentifier HostPorterTemporaryLocalFolderItemIdentifier =
    "HostPorterTemporaryLocalFolderItemIdentifier";

// Whether `identifier` is one of the four container identifiers.
bool isHostContainerIdentifier(const HostPorterItemIdentifier& identifier);

}  // namespace tamber
