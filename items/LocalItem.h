#pragma once

#include <string>

namespace tamber {

// The item record handed to the host for every file and folder. This layer so far provides the
// names of the extended attributes that hold each item's user metadata.
class LocalItem {
public:
    static const std::string& xattrLastUsedDateName();
    static const std::string& xattrTagDataName();
    static const std::string& xattrFavoriteRankName();
    static const std::string& xattrTrashDateName();
    static const std::string& xattrTrashPutBackName();
};

}  // namespace tamber
