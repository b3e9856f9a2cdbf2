#pragma once

#include <optional>
#include <string>

#include "platform/Url.h"
#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// The bytes of one extended attribute of the item at `url` (never through a final symbolic
// link), or nothing. A missing attribute is silent; a vanished file logs at debug level; any
// other failure logs at error level. Failures are never returned as errors.
std::optional<Bytes> ReadXattrData(const std::string& name, const Url& url);

// Sets the attribute on an open descriptor, or removes it when `data` is nothing. Only the
// metadata writer (ItemMetadata) calls this, so that the journal hears of every write. Removing an
// attribute that is not there succeeds. A refusal (EACCES) logs at debug level, anything else at
// error level; the error is returned.
Status SetOrRemoveXattr(int fd, const std::optional<Bytes>& data, const std::string& name);

}  // namespace tamber
