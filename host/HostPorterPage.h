#pragma once

#include "platform/objects/Data.h"

namespace tamber {

// Opaque positions the host hands back to the provider: a page token inside a listing, and a
// sync anchor in the stream of changes.
using HostPorterPage = Bytes;
using HostPorterSyncAnchor = Bytes;

// The two pages a listing can start from. They are fixed byte strings that no encoded page
// token can equal (tokens are binary property lists).
const HostPorterPage& HostPorterInitialPageSortedByDate();
const HostPorterPage& HostPorterInitialPageSortedByName();
bool isHostPorterInitialPage(const HostPorterPage& page);

}  // namespace tamber
