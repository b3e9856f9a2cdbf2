#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tamber {

// A document-ID event path, "/.docid/$dev/changed/$docid/src=$src,dst=$dst": the leading
// slashes and the device part are optional, and nothing may follow the destination. A
// destination of 0 means the document was deleted.
struct DocIDPath {
    int64_t documentID = 0;
    int64_t source = 0;
    int64_t destination = 0;

    // Numbers are read as strtoll reads them (no digits reads 0); only a conversion error,
    // a missing piece or trailing text fails.
    static std::optional<DocIDPath> parse(const std::string& path);
    // Whether `path` has the document-ID root's name followed by "/" anywhere: such an event
    // is taken for a document-ID event, and one that does not parse is reported as such.
    static bool mentionsDocumentIds(const std::string& path);
};

}  // namespace tamber
