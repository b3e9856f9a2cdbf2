#pragma once

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/archive/PlistNode.h"

namespace tamber::testing {

// Builds keyed archives and binary property lists by hand, for the shapes the real writers
// never produce.
class ArchiveCrafter {
public:
    ArchiveCrafter();

    uint64_t add(PlistNode node);
    uint64_t addString(const std::string& value) { return add(PlistNode::string(value)); }
    // A class description {"$classname": name, "$classes": [name, "Object"]}.
    uint64_t addClass(const std::string& name);
    // Copyable, so that fields can be listed in braces.
    struct Field {
        Field(std::string key, PlistNode value)
            : key(std::move(key)), value(std::make_shared<PlistNode>(std::move(value))) {}
        std::string key;
        std::shared_ptr<PlistNode> value;
    };
    uint64_t addObject(uint64_t classUid, const std::vector<Field>& fields = {});
    static PlistNode uids(const std::vector<uint64_t>& values);

    // The top-level dictionary; takes the objects, so call it once.
    PlistNode top(uint64_t root);
    Bytes finish(uint64_t root) { return toBytes(top(root)); }
    static Bytes toBytes(const PlistNode& node);

    // A binary property list written byte by byte, with four-byte references and offsets.
    static Bytes rawBinaryPlist(const std::vector<Bytes>& objects, uint64_t root);
    static Bytes rawArray(const std::vector<uint64_t>& refs);
    static Bytes rawDictionary(const std::vector<uint64_t>& keys,
                               const std::vector<uint64_t>& values);
    static Bytes rawString(const std::string& ascii);
    static Bytes rawUid(uint32_t value);

private:
    PlistNode objects_;
    uint64_t count_ = 0;
};

}  // namespace tamber::testing
