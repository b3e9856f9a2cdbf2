#include <gtest/gtest.h>

#include "platform/Tag.h"
#include "tests/platform/values/ArchiveCrafter.h"

namespace tamber {
namespace {

TEST(TagData, RoundTripKeepsOrderLabelsAndColours) {
    std::vector<std::shared_ptr<const Tag>> tags = {Tag::make("Red", 6),
                                                    Tag::make("\xC3\x9C"
                                                              "ber",
                                                              0),
                                                    Tag::make("Neg", -2), Tag::make("Red", 1)};
    auto decoded = GetTagsFromTagsData(GetTagsDataForTags(tags));
    ASSERT_TRUE(decoded);
    ASSERT_EQ(decoded->size(), tags.size());
    for (size_t i = 0; i < tags.size(); ++i) EXPECT_TRUE(tags[i]->isEqual(*(*decoded)[i])) << i;

    auto empty = GetTagsFromTagsData(GetTagsDataForTags({}));
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->empty());
}

TEST(TagData, SkipsBadEntriesAndRefusesOtherData) {
    PlistNode list = PlistNode::array();
    auto entry = [&](std::optional<PlistNode> label, std::optional<PlistNode> colour) {
        PlistNode e = PlistNode::dictionary();
        if (label)
            PlistNode::set(e.get(), "label", std::move(*label));
        if (colour)
            PlistNode::set(e.get(), "colour", std::move(*colour));
        PlistNode::append(list.get(), std::move(e));
    };
    entry(PlistNode::string("Plain"), std::nullopt);
    entry(std::nullopt, PlistNode::unsignedInteger(2));
    entry(PlistNode::unsignedInteger(5), PlistNode::unsignedInteger(2));
    PlistNode::append(list.get(), PlistNode::string("not a dictionary"));
    entry(PlistNode::string("Green"), PlistNode::unsignedInteger(2));
    auto tags = GetTagsFromTagsData(testing::ArchiveCrafter::toBytes(list));
    ASSERT_TRUE(tags);
    ASSERT_EQ(tags->size(), 2u);
    EXPECT_TRUE((*tags)[0]->isEqual(*Tag::make("Plain", 0)));
    EXPECT_TRUE((*tags)[1]->isEqual(*Tag::make("Green", 2)));

    Bytes valid = GetTagsDataForTags({Tag::make("Red", 6)});
    EXPECT_FALSE(GetTagsFromTagsData({}));
    EXPECT_FALSE(GetTagsFromTagsData(Bytes(valid.begin(), valid.end() - 1)));
    EXPECT_FALSE(GetTagsFromTagsData(testing::ArchiveCrafter::toBytes(PlistNode::dictionary())));
    EXPECT_FALSE(GetTagsFromTagsData(Bytes{'<', '?', 'x', 'm', 'l'}));
}

}  // namespace
}  // namespace tamber
