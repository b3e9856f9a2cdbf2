// Feeds arbitrary bytes to the reader of document-ID event paths, and paths the journal's
// writer makes from numbers taken off the same bytes. Every path the writer makes must read
// back to its numbers, whatever they are: a path that does not read is an event lost. A path
// that reads must be one the event classifier takes for a document-ID event, and reads the same
// when written again in the plain form.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "fs/DocIDPath.h"
#include "fuzz/support/FuzzSupport.h"
#include "platform/tremors/JournalWriter.h"

using namespace tamber;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string path(reinterpret_cast<const char*>(data), size);
    if (auto parsed = DocIDPath::parse(path)) {
        if (!DocIDPath::mentionsDocumentIds(path))
            std::abort();
        std::string plain = "/.docid/changed/" + std::to_string(parsed->documentID) +
                            "/src=" + std::to_string(parsed->source) +
                            ",dst=" + std::to_string(parsed->destination);
        auto again = DocIDPath::parse(plain);
        if (!again || again->documentID != parsed->documentID || again->source != parsed->source ||
            again->destination != parsed->destination)
            std::abort();
    }

    fuzz::InputReader in(data, size);
    const uint32_t device = static_cast<uint32_t>(in.u64());
    const uint32_t document = static_cast<uint32_t>(in.u64());
    const uint64_t source = in.u64();
    const uint64_t destination = in.u64();
    std::string written = JournalWriter::documentIdPath(device, document, source, destination);
    auto read = DocIDPath::parse(written);
    if (!read || !DocIDPath::mentionsDocumentIds(written) ||
        static_cast<uint64_t>(read->documentID) != document ||
        static_cast<uint64_t>(read->source) != source ||
        static_cast<uint64_t>(read->destination) != destination)
        std::abort();
    return 0;
}
