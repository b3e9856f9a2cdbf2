#pragma once

#include <memory>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// The routes of single items, under /api/v1/:
//   GET items/{id}             the item, as `tamber item --json`
//   GET items/{id}/path        {"id", "path"}, as `tamber path --json`
//   GET lookup?path=ABS        the item at a path of the published trees
//   GET identifiers?path=ABS   {"identifier", "id", "path"}, as `tamber id --json` (plus
//                              "identifier")
//   PATCH items/{id}           any of filename, parentIdentifier, tags, favoriteRank,
//                              lastUsedDate, trashed; answers the item as it ends up
//   DELETE items/{id}          {"deleted": ID}
class ItemRoutes {
public:
    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
};

}  // namespace tamber
