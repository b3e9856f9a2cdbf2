#include <gtest/gtest.h>

#include <atomic>
#include <cmath>
#include <limits>
#include <mutex>
#include <thread>

#include "platform/Tag.h"
#include "platform/archive/ArchiveClassRegistry.h"
#include "platform/archive/ArchiveError.h"
#include "platform/objects/Array.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "tests/platform/values/ArchiveCrafter.h"

namespace tamber {
namespace {

// A class from outside the values library, registered with a superclass.
class TestSquare : public Object {
public:
    static constexpr std::string_view kClassName = "TestSquare";
    TestSquare(int64_t side, ObjectRef name) : side(side), name(std::move(name)) {}
    std::string_view className() const override { return kClassName; }
    std::string description() const override { return "square"; }
    bool isEqual(const Object& other) const override {
        auto s = dynamic_cast<const TestSquare*>(&other);
        return s && s->side == side && objectsEqual(s->name, name);
    }
    int64_t side;
    ObjectRef name;
};

void registerTestSquare() {
    static std::once_flag once;
    std::call_once(once, [] {
        ArchiveClassRegistry::shared().add({"TestSquare",
                                            {"TestSquare", "TestShape"},
                                            [](const Object& o, KeyedArchiver& a) {
                                                auto& square = dynamic_cast<const TestSquare&>(o);
                                                a.encodeInt64(square.side, "side");
                                                a.encodeObject(square.name, "name");
                                            },
                                            [](KeyedUnarchiver& u) -> ObjectRef {
                                                auto side = u.decodeInt64("side");
                                                if (!side)
                                                    return nullptr;
                                                return std::make_shared<TestSquare>(
                                                    *side,
                                                    u.decodeObjectOfClasses("name", {"String"}));
                                            }});
    });
}

class Unregistered : public Object {
public:
    std::string_view className() const override { return "Unregistered"; }
    std::string description() const override { return {}; }
    bool isEqual(const Object&) const override { return false; }
};

ObjectRef roundTrip(const ObjectRef& object) {
    auto bytes = KeyedArchiver::archivedDataWithRootObject(object);
    EXPECT_TRUE(bytes.ok()) << bytes.error().description();
    if (!bytes.ok())
        return nullptr;
    auto decoded = KeyedUnarchiver::unarchiveObjectWithData(*bytes);
    EXPECT_TRUE(decoded.ok()) << decoded.error().description();
    return decoded.ok() ? *decoded : nullptr;
}

ObjectRef nestedArrays(size_t depth) {
    ObjectRef object = String::make("core");
    for (size_t i = 0; i < depth; ++i) object = Array::make({object});
    return object;
}

TEST(KeyedArchiveRoundTrip, DatesKeepFractionsAndNegativeTimes) {
    for (double t : {0.0, 1.5, -1.25, 1700000000.123456, -62135596800.5, 1e-9}) {
        auto date = objectCast<Date>(roundTrip(Date::make(t)));
        ASSERT_TRUE(date) << t;
        EXPECT_EQ(date->timeIntervalSince1970(), t);
    }
}

TEST(KeyedArchiveRoundTrip, NumbersKeepKindAndExactValue) {
    using K = Number::Kind;
    for (int64_t v : {std::numeric_limits<int64_t>::min(), int64_t{-1}, int64_t{0}, INT64_MAX}) {
        auto n = objectCast<Number>(roundTrip(Number::fromInt64(v)));
        ASSERT_TRUE(n);
        EXPECT_EQ(n->kind(), K::Signed);
        EXPECT_EQ(n->int64Value(), v);
    }
    for (uint64_t v : {uint64_t{0}, uint64_t{1} << 63, UINT64_MAX}) {
        auto n = objectCast<Number>(roundTrip(Number::fromUInt64(v)));
        ASSERT_TRUE(n);
        EXPECT_EQ(n->kind(), K::Unsigned);
        EXPECT_EQ(n->uint64Value(), v);
    }
    for (double v : {0.1, -0.0, 1e300, std::numeric_limits<double>::infinity(), std::nan("")}) {
        auto n = objectCast<Number>(roundTrip(Number::fromDouble(v)));
        ASSERT_TRUE(n);
        EXPECT_EQ(n->kind(), K::Floating);
        EXPECT_EQ(std::signbit(n->doubleValue()), std::signbit(v));
        if (std::isnan(v))
            EXPECT_TRUE(std::isnan(n->doubleValue()));
        else
            EXPECT_EQ(n->doubleValue(), v);
    }
    for (bool v : {true, false}) {
        auto n = objectCast<Number>(roundTrip(Number::fromBool(v)));
        ASSERT_TRUE(n);
        EXPECT_EQ(n->kind(), K::Boolean);
        EXPECT_EQ(n->boolValue(), v);
    }
}

TEST(KeyedArchiveRoundTrip, StringsDataAndTags) {
    Bytes allBytes;
    for (int i = 0; i < 256; ++i) allBytes.push_back(static_cast<uint8_t>(i));
    std::vector<ObjectRef> values = {String::make(""),
                                     String::make("plain"),
                                     String::make("h\xC3\xA9llo \xE2\x82\xAC \xF0\x9F\x98\x80"),
                                     String::make(std::string(70000, 'x')),
                                     Data::make({}),
                                     Data::make(allBytes),
                                     Tag::make("Rot \xF0\x9F\x94\xB4", 6),
                                     Tag::make("", -3)};
    for (size_t i = 0; i < values.size(); ++i) {
        auto decoded = roundTrip(values[i]);
        ASSERT_TRUE(decoded) << i;
        EXPECT_EQ(decoded->className(), values[i]->className());
        EXPECT_TRUE(values[i]->isEqual(*decoded)) << i;
    }
}

TEST(KeyedArchiveRoundTrip, NestedCollectionsAndNulls) {
    auto dictionary = Dictionary::make({{"", Number::fromInt64(-7)},
                                        {"list", Array::make({String::make("a"), nullptr})},
                                        {"\xC3\xA9t\xC3\xA9", Date::make(12.5)},
                                        {"empty", Dictionary::make({})}});
    auto root = Array::make({dictionary, Array::make({}), Tag::make("Work", 2), nullptr});
    auto decoded = roundTrip(root);
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(root->isEqual(*decoded)) << decoded->description();
    EXPECT_EQ(roundTrip(nullptr), nullptr);
}

TEST(KeyedArchiveRoundTrip, RegisteredClassWithSuperclass) {
    registerTestSquare();
    auto square = std::make_shared<TestSquare>(-4, String::make("tile"));
    auto decoded = roundTrip(square);
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(square->isEqual(*decoded));

    auto bytes = KeyedArchiver::archivedDataWithRootObject(Array::make({square})).value();
    // Allowed by its superclass; its name string is vouched for by the class.
    EXPECT_TRUE(KeyedUnarchiver::unarchivedObjectOfClasses({"Array", "TestShape"}, bytes).ok());
    auto refused = KeyedUnarchiver::unarchivedObjectOfClasses({"Array", "String"}, bytes);
    ASSERT_FALSE(refused.ok());
    EXPECT_EQ(refused.error().userInfo().at("description"), "class TestSquare is not allowed");
}

TEST(KeyedArchiveRoundTrip, SharedObjectsAreStoredOnceAndStayShared) {
    auto s = String::make("shared");
    auto n = Number::fromInt64(5);
    auto inner = Array::make({s, n});
    auto root = Array::make({s, s, n, inner, inner});
    auto bytes = KeyedArchiver::archivedDataWithRootObject(root).value();
    auto parsed = PlistNode::fromBinary(bytes, bytes.size()).value();
    // $null, the two arrays, s, n and one description each for Array and Number.
    EXPECT_EQ(PlistNode::arraySize(PlistNode::member(parsed.get(), "$objects")), 7u);

    auto decoded = objectCast<Array>(KeyedUnarchiver::unarchiveObjectWithData(bytes).value());
    ASSERT_TRUE(decoded);
    const auto& o = decoded->objects();
    EXPECT_EQ(o[0], o[1]);
    EXPECT_EQ(o[3], o[4]);
    EXPECT_EQ(objectCast<Array>(o[3])->objects()[0], o[0]);
    EXPECT_TRUE(root->isEqual(*decoded));
}

TEST(KeyedArchiveRoundTrip, ArchivingRefusesWhatCannotBeReadBack) {
    auto code = [](const ObjectRef& object) {
        auto r = KeyedArchiver::archivedDataWithRootObject(object);
        EXPECT_FALSE(r.ok());
        if (r.ok())
            return int64_t{0};
        EXPECT_EQ(r.error().domain(), kArchiveErrorDomain);
        return r.error().code();
    };
    using C = ArchiveErrorCode;
    EXPECT_EQ(code(Array::make({std::make_shared<Unregistered>()})), int64_t(C::UnregisteredClass));
    EXPECT_EQ(code(String::make(std::string("a\0b", 3))), int64_t(C::UnencodableValue));
    EXPECT_EQ(code(Tag::make("bad \xFF", 0)), int64_t(C::UnencodableValue));
    EXPECT_EQ(code(nestedArrays(KeyedUnarchiver::kMaxDepth)), int64_t(C::TooDeep));
    EXPECT_TRUE(roundTrip(nestedArrays(KeyedUnarchiver::kMaxDepth - 1)));
}

TEST(KeyedArchiveRoundTrip, RegistryServesReadersWhileAnotherLayerRegisters) {
    Bytes bytes = KeyedArchiver::archivedDataWithRootObject(
                      Array::make({Tag::make("t", 1), Number::fromInt64(2)}))
                      .value();
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 300; ++i) {
                if (t == 0)
                    ArchiveClassRegistry::shared().add(
                        {"Concurrent" + std::to_string(i),
                         {"Concurrent" + std::to_string(i)},
                         [](const Object&, KeyedArchiver&) {},
                         [](KeyedUnarchiver&) -> ObjectRef { return nullptr; }});
                else if (!KeyedUnarchiver::unarchiveObjectWithData(bytes).ok())
                    ++failures;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(failures, 0);
    auto added = ArchiveClassRegistry::shared().find("Concurrent299");
    ASSERT_TRUE(added);
    EXPECT_EQ(added->hierarchy, (std::vector<std::string>{"Concurrent299", "Object"}));
}

}  // namespace
}  // namespace tamber
