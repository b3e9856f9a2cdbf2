#include "items/LocalItem.h"

namespace tamber {

// Function-local statics: initialised once, on first use, thread-safely.
const std::string& LocalItem::xattrLastUsedDateName() {
    static const std::string name = "com.velk.lastuseddate#PS";
    return name;
}

const std::string& LocalItem::xattrTagDataName() {
    static const std::string name = "com.velk.metadata:_kHostItemUserTags";
    return name;
}

const std::string& LocalItem::xattrFavoriteRankName() {
    static const std::string name = "com.velk.favorite-rank.number#PS";
    return name;
}

const std::string& LocalItem::xattrTrashDateName() {
    static const std::string name = "com.velk.trash.time#PS";
    return name;
}

const std::string& LocalItem::xattrTrashPutBackName() {
    static const std::string name = "com.velk.trash.putback#PS";
    return name;
}

}  // namespace tamber
