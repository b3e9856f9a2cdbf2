#include "platform/Tag.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/archive/PlistNode.h"

namespace tamber {

Bytes GetTagsDataForTags(const std::vector<std::shared_ptr<const Tag>>& tags) {
    PlistNode list = PlistNode::array();
    for (const auto& tag : tags) {
        // A label libplist cannot write back unchanged would come back as a different tag.
        if (!tag || !PlistNode::isPlistString(tag->label()))
            continue;
        PlistNode entry = PlistNode::dictionary();
        PlistNode::set(entry.get(), "label", PlistNode::string(tag->label()));
        PlistNode::set(entry.get(), "colour",
                       PlistNode::unsignedInteger(static_cast<uint64_t>(tag->colour())));
        PlistNode::append(list.get(), std::move(entry));
    }
    auto bytes = list.toBinary();
    return bytes.ok() ? std::move(bytes).value() : Bytes{};
}

std::optional<std::vector<std::shared_ptr<const Tag>>> GetTagsFromTagsData(const Bytes& data) {
    auto parsed = PlistNode::fromBinary(data, KeyedUnarchiver::kMaxInputSize);
    if (!parsed.ok() || !PlistNode::isType(parsed->get(), PLIST_ARRAY))
        return std::nullopt;
    std::vector<std::shared_ptr<const Tag>> tags;
    for (plist_t entry : PlistNode::elements(parsed->get())) {
        auto label = PlistNode::stringValue(PlistNode::member(entry, "label"));
        if (!label || !PlistNode::isPlistString(*label))
            continue;
        // libplist integers are unsigned; negative colours come back from their bits.
        auto colour = PlistNode::unsignedValue(PlistNode::member(entry, "colour"));
        tags.push_back(Tag::make(std::move(*label), static_cast<int64_t>(colour.value_or(0))));
    }
    return tags;
}

}  // namespace tamber
