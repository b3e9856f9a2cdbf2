#include <gtest/gtest.h>

#include <functional>
#include <random>

#include "platform/Tag.h"
#include "platform/archive/ArchiveError.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/Array.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "tests/platform/values/ArchiveCrafter.h"

namespace tamber {
namespace {

using testing::ArchiveCrafter;
using C = ArchiveErrorCode;

// The error's code and description, or {0, ""} when the archive decoded.
std::pair<int64_t, std::string> failure(const Bytes& bytes,
                                        const std::optional<std::set<std::string>>& classes = {}) {
    auto r = classes ? KeyedUnarchiver::unarchivedObjectOfClasses(*classes, bytes)
                     : KeyedUnarchiver::unarchiveObjectWithData(bytes);
    if (r.ok())
        return {0, ""};
    EXPECT_EQ(r.error().domain(), kArchiveErrorDomain);
    return {r.error().code(), r.error().userInfo().at("description")};
}

Bytes archive(const ObjectRef& object) {
    return KeyedArchiver::archivedDataWithRootObject(object).value();
}

std::vector<Bytes> validArchives() {
    auto s = String::make("s");
    return {archive(Array::make(
                {s, Number::fromInt64(-2), Date::make(1.5), s,
                 Dictionary::make({{"k", Data::make({1, 2})}, {"t", Tag::make("x", 3)}})})),
            archive(Tag::make("Blue", 4)), archive(Number::fromUInt64(UINT64_MAX))};
}

// Arrays nested `depth` deep, each holding the next.
Bytes arrayChain(size_t depth) {
    ArchiveCrafter c;
    uint64_t cls = c.addClass("Array");
    for (size_t i = 0; i < depth; ++i)
        c.addObject(cls, {{"objects",
                           ArchiveCrafter::uids(i + 1 < depth ? std::vector<uint64_t>{cls + i + 2}
                                                              : std::vector<uint64_t>{})}});
    return c.finish(cls + 1);
}

// One array of kMaxObjects + 1 distinct UIDs, written directly: the archiver refuses to write
// it, and libplist's writer takes minutes over a million distinct UIDs.
Bytes tooManyObjects() {
    using A = ArchiveCrafter;
    const uint64_t n = KeyedUnarchiver::kMaxObjects + 1;
    const uint64_t firstUid = 20;  // bplist index of the UID of object 3
    std::vector<uint64_t> objects = {8, 9, 14};
    std::vector<uint64_t> refs;
    for (uint64_t i = 0; i < n; ++i) {
        objects.push_back(19);
        refs.push_back(firstUid + i);
    }
    std::vector<Bytes> plist = {A::rawDictionary({1, 3, 5}, {2, 4, 6}),
                                A::rawString("$archiver"),
                                A::rawString("KeyedArchiver"),
                                A::rawString("$top"),
                                A::rawDictionary({7}, {18}),
                                A::rawString("$objects"),
                                A::rawArray(objects),
                                A::rawString("root"),
                                A::rawString("$null"),
                                A::rawDictionary({10, 12}, {11, 13}),  // 9: class description
                                A::rawString("$classname"),
                                A::rawString("Array"),
                                A::rawString("$classes"),
                                A::rawArray({11}),
                                A::rawDictionary({15, 16}, {17, 21}),  // 14: the array
                                A::rawString("$class"),
                                A::rawString("objects"),
                                A::rawUid(1),
                                A::rawUid(2),
                                A::rawString("same")};
    plist[14] = A::rawDictionary({15, 16}, {17, plist.size() + n});
    for (uint64_t i = 0; i < n; ++i) plist.push_back(A::rawUid(static_cast<uint32_t>(3 + i)));
    plist.push_back(A::rawArray(refs));
    return A::rawBinaryPlist(plist, 0);
}

TEST(KeyedUnarchiverHostile, TopLevelOfTheWrongShape) {
    std::vector<std::function<void(plist_t)>> breakages = {
        [](plist_t t) { plist_dict_remove_item(t, "$archiver"); },
        [](plist_t t) { plist_dict_set_item(t, "$archiver", plist_new_string("Other")); },
        [](plist_t t) { plist_dict_set_item(t, "$version", plist_new_string("1")); },
        [](plist_t t) { plist_dict_set_item(t, "$top", plist_new_string("root")); },
        [](plist_t t) {
            plist_dict_set_item(plist_dict_get_item(t, "$top"), "root", plist_new_uint(1));
        },
        [](plist_t t) { plist_dict_set_item(t, "$objects", plist_new_dict()); },
        [](plist_t t) {
            plist_array_set_item(plist_dict_get_item(t, "$objects"), plist_new_string("x"), 0);
        },
    };
    for (size_t i = 0; i < breakages.size(); ++i) {
        ArchiveCrafter c;
        PlistNode top = c.top(c.addString("root"));
        breakages[i](top.get());
        EXPECT_EQ(failure(ArchiveCrafter::toBytes(top)).first, int64_t(C::InvalidData)) << i;
    }
    PlistNode array = PlistNode::array();
    EXPECT_EQ(failure(ArchiveCrafter::toBytes(array)).first, int64_t(C::InvalidData));
    EXPECT_EQ(failure(Bytes(KeyedUnarchiver::kMaxInputSize + 1, 0)).first,
              int64_t(C::InputTooLarge));
}

TEST(KeyedUnarchiverHostile, BadReferencesAndCycles) {
    ArchiveCrafter outOfRange;
    outOfRange.addString("x");
    EXPECT_EQ(
        failure(outOfRange.finish(9)),
        std::make_pair(int64_t(C::UidOutOfRange), std::string("UID 9 out of range (2 objects)")));

    ArchiveCrafter self;
    uint64_t cls = self.addClass("Array");
    self.addObject(cls, {{"objects", ArchiveCrafter::uids({1, 2})}});  // 1 is the description
    EXPECT_EQ(failure(self.finish(2)).first, int64_t(C::MalformedClass));

    ArchiveCrafter selfArray;
    cls = selfArray.addClass("Array");
    selfArray.addObject(cls, {{"objects", ArchiveCrafter::uids({2})}});
    EXPECT_EQ(
        failure(selfArray.finish(2)),
        std::make_pair(int64_t(C::ReferenceCycle), std::string("reference cycle at object 2")));

    ArchiveCrafter pair;
    cls = pair.addClass("Array");
    uint64_t dict = pair.addClass("Dictionary");
    uint64_t key = pair.addString("k");
    pair.addObject(cls, {{"objects", ArchiveCrafter::uids({5})}});
    pair.addObject(dict,
                   {{"keys", ArchiveCrafter::uids({key})}, {"values", ArchiveCrafter::uids({4})}});
    EXPECT_EQ(failure(pair.finish(4)).first, int64_t(C::ReferenceCycle));
}

TEST(KeyedUnarchiverHostile, NestingAndObjectCountLimits) {
    EXPECT_EQ(failure(arrayChain(KeyedUnarchiver::kMaxDepth)).first, 0);
    EXPECT_EQ(failure(arrayChain(KeyedUnarchiver::kMaxDepth + 1)).first, int64_t(C::TooDeep));

    EXPECT_EQ(failure(tooManyObjects()).first, int64_t(C::TooManyObjects));
}

TEST(KeyedUnarchiverHostile, SharingLikeBillionLaughsStaysLinear) {
    ObjectRef level = String::make("lol");
    for (int i = 0; i < 200; ++i) level = Array::make({level, level, level});
    Bytes bytes = archive(level);
    EXPECT_LT(bytes.size(), 20000u);
    auto decoded = objectCast<Array>(KeyedUnarchiver::unarchiveObjectWithData(bytes).value());
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->objects()[0], decoded->objects()[2]);
    EXPECT_EQ(archive(decoded), bytes);
}

TEST(KeyedUnarchiverHostile, MalformedObjectsAndClasses) {
    struct Case {
        std::function<uint64_t(ArchiveCrafter&)> build;
        C code;
    };
    auto str = [](const char* s) { return PlistNode::string(s); };
    std::vector<Case> cases = {
        {[](ArchiveCrafter& c) { return c.add(PlistNode::unsignedInteger(3)); }, C::InvalidData},
        {[](ArchiveCrafter& c) { return c.addObject(c.addString("x"), {}); }, C::MalformedClass},
        {[](ArchiveCrafter& c) { return c.addObject(40, {}); }, C::UidOutOfRange},
        {[&](ArchiveCrafter& c) {
             PlistNode d = PlistNode::dictionary();
             PlistNode::set(d.get(), "$classname", str("Date"));
             return c.addObject(c.add(std::move(d)), {});
         },
         C::MalformedClass},
        {[](ArchiveCrafter& c) { return c.addObject(c.addClass("Bogus"), {}); }, C::UnknownClass},
        {[&](ArchiveCrafter& c) {
             return c.addObject(c.addClass("Date"), {{"time", str("now")}});
         },
         C::InvalidValue},
        {[](ArchiveCrafter& c) {
             return c.addObject(c.addClass("Number"), {{"kind", PlistNode::unsignedInteger(9)},
                                                       {"value", PlistNode::unsignedInteger(1)}});
         },
         C::InvalidValue},
        {[](ArchiveCrafter& c) {
             return c.addObject(c.addClass("Number"), {{"kind", PlistNode::unsignedInteger(1)},
                                                       {"value", PlistNode::real(1)}});
         },
         C::InvalidValue},
        {[](ArchiveCrafter& c) {
             return c.addObject(c.addClass("Tag"), {{"colour", PlistNode::unsignedInteger(1)}});
         },
         C::InvalidValue},
        {[](ArchiveCrafter& c) {
             uint64_t n = c.addObject(c.addClass("Date"), {{"time", PlistNode::real(0)}});
             return c.addObject(c.addClass("Dictionary"), {{"keys", ArchiveCrafter::uids({n})},
                                                           {"values", ArchiveCrafter::uids({n})}});
         },
         C::InvalidValue},  // a key that is not a string
        {[](ArchiveCrafter& c) {
             uint64_t k = c.addString("k");
             return c.addObject(c.addClass("Dictionary"), {{"keys", ArchiveCrafter::uids({k, k})},
                                                           {"values", ArchiveCrafter::uids({k})}});
         },
         C::InvalidValue},
        {[](ArchiveCrafter& c) {
             uint64_t k = c.addString("k");
             return c.addObject(c.addClass("Dictionary"),
                                {{"keys", ArchiveCrafter::uids({k, k})},
                                 {"values", ArchiveCrafter::uids({k, k})}});
         },
         C::InvalidValue},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        ArchiveCrafter c;
        uint64_t root = cases[i].build(c);
        EXPECT_EQ(failure(c.finish(root)).first, int64_t(cases[i].code)) << i;
    }
}

TEST(KeyedUnarchiverHostile, AllowedClassesApplyToEveryDecodedObject) {
    using Set = std::set<std::string>;
    Bytes strings = archive(Array::make({String::make("a"), String::make("b")}));
    Bytes mixed = archive(Array::make({String::make("a"), Number::fromInt64(1)}));
    EXPECT_EQ(failure(strings, Set{"Array", "String"}).first, 0);
    EXPECT_EQ(
        failure(mixed, Set{"Array", "String"}),
        std::make_pair(int64_t(C::ClassNotAllowed), std::string("class Number is not allowed")));
    EXPECT_EQ(failure(strings, Set{"String"}).first, int64_t(C::ClassNotAllowed));

    Bytes numbersByName = archive(Dictionary::make({{"n", Number::fromInt64(1)}}));
    EXPECT_EQ(failure(numbersByName, Set{"Dictionary", "Number"}).first, 0);
    EXPECT_EQ(
        failure(archive(Dictionary::make({{"s", String::make("v")}})), Set{"Dictionary", "Number"})
            .first,
        int64_t(C::ClassNotAllowed));

    EXPECT_EQ(
        KeyedUnarchiver::unarchivedObjectOfClass<Tag>(archive(Tag::make("t", 1))).value()->label(),
        "t");
    auto wrong = KeyedUnarchiver::unarchivedObjectOfClass<Array>(archive(nullptr));
    ASSERT_FALSE(wrong.ok());
    EXPECT_EQ(wrong.error().code(), int64_t(C::WrongClass));

    // A string a Tag vouched for may not then appear where strings are not allowed.
    ArchiveCrafter c;
    uint64_t label = c.addString("label");
    uint64_t tag = c.addObject(c.addClass("Tag"), {{"label", PlistNode::uid(label)}});
    uint64_t root =
        c.addObject(c.addClass("Array"), {{"objects", ArchiveCrafter::uids({tag, label})}});
    EXPECT_EQ(
        failure(c.finish(root), Set{"Array", "Tag"}),
        std::make_pair(int64_t(C::ClassNotAllowed), std::string("class String is not allowed")));
}

TEST(KeyedUnarchiverHostile, EveryTruncationFailsCleanly) {
    for (const Bytes& bytes : validArchives()) {
        for (size_t n = 0; n < bytes.size(); ++n) {
            Bytes prefix(bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(n));
            EXPECT_EQ(failure(prefix).first, int64_t(C::InvalidData)) << n;
        }
    }
}

TEST(KeyedUnarchiverHostile, RandomBytesFailCleanly) {
    std::mt19937 random(7);
    for (int i = 0; i < 2000; ++i) {
        Bytes bytes(random() % 200);
        for (auto& b : bytes) b = static_cast<uint8_t>(random());
        if (i % 2 && bytes.size() >= 8)
            std::copy_n("bplist00", 8, bytes.begin());
        EXPECT_NE(failure(bytes).first, 0);
    }
}

// What the fuzzer does, deterministically and without it: damaged archives either fail with an
// error or decode to something that archives again and reads back the same.
TEST(KeyedUnarchiverHostile, MutatedArchivesNeverCrashAndRoundTripWhenAccepted) {
    std::mt19937 random(20240607);
    const std::vector<Bytes> corpus = validArchives();
    const uint8_t interesting[] = {0x00, 0x01, 0x0F, 0x10, 0x13, 0x7F, 0x80, 0xAF, 0xD0, 0xFF};
    int accepted = 0;
    int refused = 0;
    for (int i = 0; i < 4000; ++i) {
        Bytes bytes = corpus[random() % corpus.size()];
        for (unsigned edits = 1 + random() % 3; edits > 0 && !bytes.empty(); --edits) {
            size_t at = random() % bytes.size();
            switch (random() % 5) {
                case 0:
                    bytes[at] ^= static_cast<uint8_t>(1u << (random() % 8));
                    break;
                case 1:
                    bytes[at] = interesting[random() % sizeof interesting];
                    break;
                case 2:
                    bytes.insert(bytes.begin() + static_cast<ptrdiff_t>(at),
                                 static_cast<uint8_t>(random()));
                    break;
                case 3:
                    bytes.erase(bytes.begin() + static_cast<ptrdiff_t>(at));
                    break;
                default:
                    bytes[at] = static_cast<uint8_t>(bytes[at] + 1);
                    break;
            }
        }
        auto decoded = KeyedUnarchiver::unarchiveObjectWithData(bytes);
        (void)KeyedUnarchiver::unarchivedObjectOfClasses({"Array", "String"}, bytes);
        if (!decoded.ok()) {
            EXPECT_EQ(decoded.error().domain(), kArchiveErrorDomain);
            ++refused;
            continue;
        }
        ++accepted;
        auto again = KeyedArchiver::archivedDataWithRootObject(*decoded);
        ASSERT_TRUE(again.ok()) << again.error().description();
        auto reread = KeyedUnarchiver::unarchiveObjectWithData(*again);
        ASSERT_TRUE(reread.ok()) << reread.error().description();
        EXPECT_EQ(archive(*reread), *again);
    }
    EXPECT_GT(accepted, 50);
    EXPECT_GT(refused, 1000);
}

}  // namespace
}  // namespace tamber
