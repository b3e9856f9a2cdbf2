#include <gtest/gtest.h>

#include <functional>

#include "platform/apps/AppRecord.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/archive/PlistNode.h"
#include "platform/objects/Array.h"
#include "platform/objects/Number.h"

namespace tamber {
namespace {

Bytes archive(const ObjectRef& root) {
    return KeyedArchiver::archivedDataWithRootObject(root).value();
}

BundleRecord::Fields fullFields() {
    return {"org.example.Notes", "Notes", Url::fileURLWithPath("/home/u/.var/app/notes"), "notes"};
}

TEST(BundleRecordArchiveTest, RecordsRoundTripAndApplicationsComeBackAsPlainRecords) {
    BundleRecord::registerArchiveClass();
    auto app = AppRecord::make(fullFields(), {true, true, Dictionary::make({})});
    auto sparse = BundleRecord::make({"org.example.Bare", std::nullopt, std::nullopt, ""});

    // The classes the app-library cache allows: a record vouches for its own string fields.
    auto decoded = KeyedUnarchiver::unarchivedObjectOfClasses({"Array", "BundleRecord"},
                                                              archive(Array::make({app, sparse})));
    ASSERT_TRUE(decoded.ok()) << decoded.error().description();
    auto records = objectCast<Array>(decoded.value())->objects();
    ASSERT_EQ(records.size(), 2u);
    EXPECT_FALSE(objectCast<AppRecord>(records[0]));
    EXPECT_TRUE(records[0]->isEqual(*app));
    EXPECT_TRUE(records[1]->isEqual(*sparse));
    EXPECT_FALSE(records[1]->isEqual(*app));
}

TEST(BundleRecordArchiveTest, FieldsOfTheWrongTypeAreRefused) {
    BundleRecord::registerArchiveClass();
    const Bytes good =
        archive(Array::make({BundleRecord::make(fullFields()), Number::fromInt64(7)}));
    // Each case rewrites one field of the record, given the archive's objects.
    using Rewrite = std::function<PlistNode(const std::vector<plist_t>&, uint64_t numberUid,
                                            uint64_t stringUid)>;
    const std::pair<const char*, Rewrite> cases[] = {
        {"bundleIdentifier", [](auto&, auto, auto) { return PlistNode::unsignedInteger(3); }},
        {"displayName", [](auto&, auto number, auto) { return PlistNode::uid(number); }},
        {"iconName", [](auto&, auto, auto) { return PlistNode::string("inline, no reference"); }},
        // A relative container would resolve against the working directory.
        {"dataContainerPath",
         [](auto& objects, auto, auto string) {
             plist_set_string_val(objects[string], "relative/dir");
             return PlistNode::uid(string);
         }},
    };
    for (const auto& [key, rewrite] : cases) {
        auto top = PlistNode::fromBinary(good, good.size()).value();
        auto objects = PlistNode::elements(PlistNode::member(top.get(), "$objects"));
        plist_t fields = nullptr;
        uint64_t numberUid = 0;
        for (size_t i = 0; i < objects.size(); ++i) {
            if (PlistNode::member(objects[i], "bundleIdentifier"))
                fields = objects[i];
            if (PlistNode::member(objects[i], "kind"))
                numberUid = i;
        }
        ASSERT_TRUE(fields && numberUid);
        auto stringUid = PlistNode::uidValue(PlistNode::member(fields, "displayName")).value();
        PlistNode::set(fields, key, rewrite(objects, numberUid, stringUid));
        auto r = KeyedUnarchiver::unarchiveObjectWithData(top.toBinary().value());
        ASSERT_FALSE(r.ok()) << key;
        EXPECT_EQ(r.error().domain(), kArchiveErrorDomain);
    }
}

}  // namespace
}  // namespace tamber
