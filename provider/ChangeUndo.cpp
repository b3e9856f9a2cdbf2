#include "provider/ChangeUndo.h"

#include <optional>
#include <string>

#include "host/UrlOperations.h"
#include "support/Log.h"

namespace tamber {

ChangeUndo moveBackTo(const Url& original) {
    return [original](const Url& moved, std::function<void()> done) {
        pt_reparentUnderFolder(moved, original.deletingLastPathComponent(),
                               std::optional<std::string>(original.lastPathComponent()),
                               [moved, original, done](Result<Url> back) {
                                   if (!back.ok())
                                       logError("can't move \"" + moved.path() + "\" back to \"" +
                                                original.path() + "\" after a failure; " +
                                                back.error().description());
                                   done();
                               });
    };
}

ChangeUndo removeMade() {
    return [](const Url& made, std::function<void()> done) {
        pt_deleteWithCompletionHandler(made, [made, done](Status status) {
            if (!status.ok())
                logError("can't remove \"" + made.path() + "\" after a failure; " +
                         status.error().description());
            done();
        });
    };
}

}  // namespace tamber
