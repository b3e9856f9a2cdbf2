#pragma once

#include <vector>

#include "platform/Url.h"

namespace tamber {

// The app-library roots as the rest of the extension sees them. Holds no state.
class TBPAppLibraryManager {
public:
    TBPAppLibraryManager() = default;

    // The root URLs of the shared manager's app libraries, in its map order.
    static std::vector<Url> rootURLsForAppLibraries();
};

}  // namespace tamber
