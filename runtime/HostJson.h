#pragma once

#include <optional>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/HostPorterItem.h"
#include "host/HostPorterPage.h"
#include "platform/tremors/JournalEvent.h"
#include "runtime/ChangeCollector.h"
#include "support/Error.h"

namespace tamber {

// The JSON a host prints or sends for what the provider answers. Every host encodes through
// these, so that the command line and the server agree byte for byte.
class HostJson {
public:
    // An item record: identifiers, name, type, sizes, dates, capabilities, tags, rank, trash
    // state, and the path when the item is a file of the published trees. A name or path that is
    // not UTF-8 shows U+FFFD, with its exact bytes in base64 beside it.
    static nlohmann::json item(const HostPorterItem& item);
    // A listing: {"items": [...], "nextPage": base64 token or null}.
    static nlohmann::json page(const std::vector<HostPorterItemRef>& items,
                               const std::optional<HostPorterPage>& nextPage);
    // A finished change batch: {"updated": [...], "deleted": [...], "changes": [in order],
    // "anchor": base64 or "", "moreComing": bool}.
    static nlohmann::json changeBatch(const ChangeCollector::Batch& batch);
    // The app libraries the process publishes, by identifier: {"versionToken": N, "libraries":
    // [{"identifier", "name", "bundleIdentifier", "root"}]}.
    static nlohmann::json appLibraries();
    // One event of the journal: {"id", "flags", "path" (and "pathBytes" when it is not UTF-8),
    // "fileID" or null}.
    static nlohmann::json journalEvent(const JournalEvent& event);
    // The event a journalEvent() record describes; nothing when it is not one.
    static std::optional<JournalEvent> journalEventFromJson(const nlohmann::json& json);
    // {"error": {"domain", "code", "message"}}, with "usage": true for an error made from bad
    // command-line input and "outside": true for a refusal of something outside the published
    // trees, so that a client can tell them apart as this host does.
    static nlohmann::json error(const Error& error);
    // The error an error object describes, with the same domain, code, message and marks;
    // nothing when `json` is not an error object.
    static std::optional<Error> errorFromJson(const nlohmann::json& json);
};

}  // namespace tamber
