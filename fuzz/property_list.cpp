// Feeds arbitrary bytes to the binary property list reader (the validator in front of libplist)
// and to the tag data decoder. A property list that parses must write back out and parse again.
#include <cstdint>
#include <cstdlib>

#include "platform/Tag.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/archive/PlistNode.h"

using namespace tamber;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto parsed = PlistNode::fromBinary(data, size, KeyedUnarchiver::kMaxInputSize);
    if (parsed.ok()) {
        auto written = parsed->toBinary();
        if (!written.ok() || !PlistNode::fromBinary(*written, KeyedUnarchiver::kMaxInputSize).ok())
            std::abort();
    }
    auto tags = GetTagsFromTagsData(Bytes(data, data + size));
    if (tags) {
        auto again = GetTagsFromTagsData(GetTagsDataForTags(*tags));
        if (!again || again->size() != tags->size())
            std::abort();
        for (size_t i = 0; i < tags->size(); ++i)
            if (!(*tags)[i]->isEqual(*(*again)[i]))
                std::abort();
    }
    return 0;
}
