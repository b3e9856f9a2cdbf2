#include <gtest/gtest.h>

#include "platform/Tag.h"
#include "runtime/Base64.h"
#include "runtime/HostJson.h"
#include "tests/runtime/FakeItem.h"

namespace tamber {
namespace {

TEST(HostJsonTest, ItemNamesThatAreNotUtf8KeepTheirBytesBesideTheReplacement) {
    const std::string bad = std::string("r\xE9sum\xE9") + "\n.txt";
    nlohmann::json json = HostJson::item(*FakeItem::make("did=5", bad));
    EXPECT_EQ(json["filename"], "r\uFFFDsum\uFFFD\n.txt");
    EXPECT_EQ(json["filenameBytes"], base64Encode(Bytes(bad.begin(), bad.end())));
    EXPECT_NO_THROW((void)json.dump());
    // Only files of the published trees have a path; the item interface alone has none.
    EXPECT_FALSE(json.contains("path"));

    nlohmann::json plain = HostJson::item(*FakeItem::make("did=6", "notes.txt"));
    EXPECT_EQ(plain["filename"], "notes.txt");
    EXPECT_FALSE(plain.contains("filenameBytes"));
    EXPECT_EQ(plain["identifier"], "did=6");
    EXPECT_EQ(plain["capabilities"], 0x21);
    EXPECT_TRUE(plain["lastUsedDate"].is_null());
    EXPECT_EQ(plain["tags"], nlohmann::json::array());
}

TEST(HostJsonTest, TagsAreTheirLabelsInOrderAndBrokenTagDataIsNoTags) {
    auto data = GetTagsDataForTags({Tag::make("Work"), Tag::make("Travel")});
    EXPECT_EQ(HostJson::item(*FakeItem::make("did=1", "a", data))["tags"],
              (nlohmann::json{"Work", "Travel"}));
    EXPECT_EQ(HostJson::item(*FakeItem::make("did=1", "a", Bytes{0xff, 0x00}))["tags"],
              nlohmann::json::array());
}

TEST(HostJsonTest, PagesAndBatchesCarryTheirTokensAndOrder) {
    nlohmann::json last = HostJson::page({FakeItem::make("did=1", "a")}, std::nullopt);
    EXPECT_TRUE(last["nextPage"].is_null());
    ASSERT_EQ(last["items"].size(), 1u);
    nlohmann::json more = HostJson::page({}, Bytes{1, 2, 3});
    EXPECT_EQ(more["nextPage"], base64Encode(Bytes{1, 2, 3}));
    EXPECT_EQ(more["items"], nlohmann::json::array());

    ChangeCollector::Batch batch;
    auto reused = FakeItem::make("fid=9", "new");
    batch.changes = {{nullptr, "fid=9"}, {reused, {}}};
    batch.updated = {reused};
    batch.deleted = {"fid=9"};
    batch.anchor = Bytes{9};
    batch.moreComing = true;
    nlohmann::json json = HostJson::changeBatch(batch);
    ASSERT_EQ(json["changes"].size(), 2u);
    EXPECT_EQ(json["changes"][0], (nlohmann::json{{"deleted", "fid=9"}}));
    EXPECT_EQ(json["changes"][1]["updated"]["identifier"], "fid=9");
    EXPECT_EQ(json["updated"].size(), 1u);
    EXPECT_EQ(json["deleted"], (nlohmann::json{"fid=9"}));
    EXPECT_EQ(json["anchor"], base64Encode(Bytes{9}));
    EXPECT_EQ(json["moreComing"], true);
    batch.anchor.reset();
    EXPECT_EQ(HostJson::changeBatch(batch)["anchor"], "");
}

TEST(HostJsonTest, ErrorsGiveDomainCodeAndTheMessageAlone) {
    nlohmann::json json =
        HostJson::error(Error::porterErrorForNonExistentItemWithIdentifier("did=7"));
    EXPECT_EQ(json["error"]["domain"], kHostPorterErrorDomain);
    EXPECT_EQ(json["error"]["code"], kHostPorterNoSuchItem);
    const std::string message = json["error"]["message"];
    EXPECT_NE(message.find("did=7"), std::string::npos);
    EXPECT_EQ(message.find("Domain="), std::string::npos) << "the reason, not the description";
}

}  // namespace
}  // namespace tamber
