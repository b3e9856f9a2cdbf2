#pragma once

#include <memory>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// The routes of containers and of the provider as a whole, under /api/v1/:
//   GET containers/{id}/children?page=T   one page and "nextPage", as `tamber ls --json`
//   POST containers/{id}/children         {"folder": NAME, "bounce": bool} creates a folder,
//                                         {"import": ABSOLUTE_SOURCE} imports a copy; a
//                                         multipart upload goes to ApiContext::multipartUpload
//   GET containers/{id}/anchor            {"anchor": A}
//   GET containers/{id}/changes?anchor=A  one batch, as `tamber changes --json`
//   GET apps, POST apps/refresh           as `tamber apps --json`
//   POST trash/purge?olderThan=30d        {"removed": N}
class ContainerRoutes {
public:
    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context);
};

}  // namespace tamber
