#pragma once

#include <functional>

#include "platform/Url.h"

namespace tamber {

// Calls `visit` for everything below `folder` that is not hidden, parents before their
// contents, through folders opened beneath the published trees without following any link;
// `visit` returns whether to go into the entry when it is a folder (not into a package, say).
// Folders that cannot be read are passed over. For telling a host about the contents of a folder
// that moved into or out of a trash: they leave or join the working set with it.
void forEachVisibleDescendant(const Url& folder, const std::function<bool(const Url&)>& visit);

}  // namespace tamber
