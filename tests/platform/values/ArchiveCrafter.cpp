#include "tests/platform/values/ArchiveCrafter.h"

#include <algorithm>

namespace tamber::testing {

namespace {
void appendBigEndian(Bytes& out, uint64_t value, int width) {
    for (int i = width - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(value >> (8 * i)));
}
}  // namespace

ArchiveCrafter::ArchiveCrafter() : objects_(PlistNode::array()) {
    addString("$null");
}

uint64_t ArchiveCrafter::add(PlistNode node) {
    PlistNode::append(objects_.get(), std::move(node));
    return count_++;
}

uint64_t ArchiveCrafter::addClass(const std::string& name) {
    PlistNode description = PlistNode::dictionary();
    PlistNode::set(description.get(), "$classname", PlistNode::string(name));
    PlistNode names = PlistNode::array();
    PlistNode::append(names.get(), PlistNode::string(name));
    PlistNode::append(names.get(), PlistNode::string("Object"));
    PlistNode::set(description.get(), "$classes", std::move(names));
    return add(std::move(description));
}

uint64_t ArchiveCrafter::addObject(uint64_t classUid, const std::vector<Field>& fields) {
    PlistNode object = PlistNode::dictionary();
    PlistNode::set(object.get(), "$class", PlistNode::uid(classUid));
    for (const auto& field : fields)
        PlistNode::set(object.get(), field.key, std::move(*field.value));
    return add(std::move(object));
}

PlistNode ArchiveCrafter::uids(const std::vector<uint64_t>& values) {
    PlistNode array = PlistNode::array();
    for (uint64_t v : values) PlistNode::append(array.get(), PlistNode::uid(v));
    return array;
}

PlistNode ArchiveCrafter::top(uint64_t root) {
    PlistNode top = PlistNode::dictionary();
    PlistNode::set(top.get(), "$archiver", PlistNode::string("KeyedArchiver"));
    PlistNode::set(top.get(), "$version", PlistNode::unsignedInteger(100000));
    PlistNode rootDictionary = PlistNode::dictionary();
    PlistNode::set(rootDictionary.get(), "root", PlistNode::uid(root));
    PlistNode::set(top.get(), "$top", std::move(rootDictionary));
    PlistNode::set(top.get(), "$objects", std::move(objects_));
    return top;
}

Bytes ArchiveCrafter::toBytes(const PlistNode& node) {
    return node.toBinary().value();
}

Bytes ArchiveCrafter::rawBinaryPlist(const std::vector<Bytes>& objects, uint64_t root) {
    Bytes out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
    std::vector<uint64_t> offsets;
    for (const auto& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    uint64_t table = out.size();
    for (uint64_t offset : offsets) appendBigEndian(out, offset, 4);
    out.insert(out.end(), 6, 0);
    out.push_back(4);  // offset width
    out.push_back(4);  // reference width
    appendBigEndian(out, objects.size(), 8);
    appendBigEndian(out, root, 8);
    appendBigEndian(out, table, 8);
    return out;
}

Bytes ArchiveCrafter::rawArray(const std::vector<uint64_t>& refs) {
    Bytes out;
    if (refs.size() < 15) {
        out.push_back(static_cast<uint8_t>(0xA0 | refs.size()));
    } else {
        out = {0xAF, 0x12};
        appendBigEndian(out, refs.size(), 4);
    }
    for (uint64_t ref : refs) appendBigEndian(out, ref, 4);
    return out;
}

Bytes ArchiveCrafter::rawDictionary(const std::vector<uint64_t>& keys,
                                    const std::vector<uint64_t>& values) {
    Bytes out{static_cast<uint8_t>(0xD0 | keys.size())};
    for (uint64_t ref : keys) appendBigEndian(out, ref, 4);
    for (uint64_t ref : values) appendBigEndian(out, ref, 4);
    return out;
}

Bytes ArchiveCrafter::rawString(const std::string& ascii) {
    Bytes out(1 + ascii.size());
    out[0] = static_cast<uint8_t>(0x50 | ascii.size());
    std::copy(ascii.begin(), ascii.end(), out.begin() + 1);
    return out;
}

Bytes ArchiveCrafter::rawUid(uint32_t value) {
    Bytes out{0x83};
    appendBigEndian(out, value, 4);
    return out;
}

}  // namespace tamber::testing
