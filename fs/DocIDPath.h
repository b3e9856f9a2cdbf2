#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tamber {

// A document-ID event path, "/.docid/$dev/changed/$docid/src=$src,dst=$dst": the leading
// slashes and the device part are optional, and nothing may follow the destination. A
// destination of 0 means the document was deleted.
struct DocIDPath {
    uint64_t documentID = 0;
    uint64_t source = 0;
    uint64_t destination = 0;

    // Numbers are unsigned 64-bit, as the journal writes inode numbers, and read as strtoull
    // reads them (no digits reads 0) except that a sign fails; so do a number out of range, a
    // missing piece and trailing text.
    static std::optional<DocIDPath> parse(const std::string& path);
    // Whether `path` has the document-ID root's name followed by "/" anywhere: such an event
    // is taken for a document-ID event, and one that does not parse is reported as such.
    static bool mentionsDocumentIds(const std::string& path);
};

}  // namespace tamber
