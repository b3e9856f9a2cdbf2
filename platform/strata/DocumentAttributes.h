#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Data.h"

namespace tamber {

// The metadata attributes that follow a document from inode to inode (tags, last-used date,
// favourite rank, trash date and put-back path, plus the desktop's tag list "xdg.tags" and
// Tamber's note of it, which must move with the tags), read and written as raw bytes through
// FileSystem. Names are without the "user." prefix. What they mean is the item layer's business.
class DocumentAttributes {
public:
    using Values = std::map<std::string, Bytes>;

    static const std::vector<std::string>& names();
    static bool isKept(std::string_view name);

    // The kept attributes of the file at `path` (never through a final symbolic link); nothing
    // when they cannot be listed or read (a vanished file, for one).
    static std::optional<Values> read(const std::string& path);

    // Gives the regular file at `path`, when it is still the inode `inode`, each attribute of
    // `saved` that it lacks, through a descriptor opened O_RDONLY | O_NOFOLLOW; attributes it has
    // keep their value. Returns the copy to keep from now on (what the file holds, plus what
    // could not be written to it), or nothing when it is not that file any more or could not be
    // read.
    static std::optional<Values> restore(const std::string& path, uint64_t inode,
                                         const Values& saved);
};

}  // namespace tamber
