#include <gtest/gtest.h>
#include <algorithm>

#include <atomic>
#include <cmath>
#include <cstring>
#include <functional>
#include <limits>
#include <random>
#include <thread>

#include "platform/Tag.h"
#include "platform/archive/ArchiveClassRegistry.h"
#include "platform/archive/ArchiveError.h"
#include "platform/archive/BinaryPlistValidator.h"
#include "platform/archive/PlistNode.h"
#include "platform/objects/Array.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"

namespace tamber {
namespace {

using C = ArchiveErrorCode;

Bytes toBytes(const PlistNode& node) {
    return node.toBinary().value();
}

// Builds keyed archives by hand, for the shapes the archiver never writes.
class Crafter {
public:
    Crafter() : objects_(PlistNode::array()) { addString("$null"); }
    uint64_t add(PlistNode node) {
        PlistNode::append(objects_.get(), std::move(node));
        return count_++;
    }
    uint64_t addString(const std::string& value) { return add(PlistNode::string(value)); }
    uint64_t addClass(const std::string& name) {
        PlistNode description = PlistNode::dictionary();
        PlistNode::set(description.get(), "$classname", PlistNode::string(name));
        PlistNode names = PlistNode::array();
        for (const std::string& n : {name, std::string("Object")})
            PlistNode::append(names.get(), PlistNode::string(n));
        PlistNode::set(description.get(), "$classes", std::move(names));
        return add(std::move(description));
    }
    struct Field {  // copyable, so that fields can be listed in braces
        Field(std::string key, PlistNode value)
            : key(std::move(key)), value(std::make_shared<PlistNode>(std::move(value))) {}
        std::string key;
        std::shared_ptr<PlistNode> value;
    };
    uint64_t addObject(uint64_t classUid, const std::vector<Field>& fields = {}) {
        PlistNode object = PlistNode::dictionary();
        PlistNode::set(object.get(), "$class", PlistNode::uid(classUid));
        for (const auto& field : fields)
            PlistNode::set(object.get(), field.key, std::move(*field.value));
        return add(std::move(object));
    }
    static PlistNode uids(const std::vector<uint64_t>& values) {
        PlistNode array = PlistNode::array();
        for (uint64_t v : values) PlistNode::append(array.get(), PlistNode::uid(v));
        return array;
    }
    // The top-level dictionary; takes the objects, so call it once.
    PlistNode top(uint64_t root) {
        PlistNode top = PlistNode::dictionary();
        PlistNode::set(top.get(), "$archiver", PlistNode::string("KeyedArchiver"));
        PlistNode::set(top.get(), "$version", PlistNode::unsignedInteger(100000));
        PlistNode rootDictionary = PlistNode::dictionary();
        PlistNode::set(rootDictionary.get(), "root", PlistNode::uid(root));
        PlistNode::set(top.get(), "$top", std::move(rootDictionary));
        PlistNode::set(top.get(), "$objects", std::move(objects_));
        return top;
    }
    Bytes finish(uint64_t root) { return toBytes(top(root)); }

private:
    PlistNode objects_;
    uint64_t count_ = 0;
};

void appendBigEndian(Bytes& out, uint64_t value, int width) {
    for (int i = width - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(value >> (8 * i)));
}

// A binary property list written byte by byte, with four-byte references and offsets.
Bytes rawBinaryPlist(const std::vector<Bytes>& objects, uint64_t root) {
    Bytes out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
    std::vector<uint64_t> offsets;
    for (const auto& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    uint64_t table = out.size();
    for (uint64_t offset : offsets) appendBigEndian(out, offset, 4);
    out.insert(out.end(), 6, 0);
    out.insert(out.end(), {4, 4});  // offset and reference widths
    for (uint64_t v : {uint64_t(objects.size()), root, table}) appendBigEndian(out, v, 8);
    return out;
}

Bytes rawArray(const std::vector<uint64_t>& refs) {
    Bytes out{static_cast<uint8_t>(0xA0 | refs.size())};  // fewer than 15 entries
    for (uint64_t ref : refs) appendBigEndian(out, ref, 4);
    return out;
}

Bytes archive(const ObjectRef& object) {
    return KeyedArchiver::archivedDataWithRootObject(object).value();
}

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

// Arrays nested `depth` deep, each holding the next.
Bytes arrayChain(size_t depth) {
    Crafter c;
    uint64_t cls = c.addClass("Array");
    for (size_t i = 0; i < depth; ++i)
        c.addObject(cls,
                    {{"objects", Crafter::uids(i + 1 < depth ? std::vector<uint64_t>{cls + i + 2}
                                                             : std::vector<uint64_t>{})}});
    return c.finish(cls + 1);
}

Bytes crafted(const std::function<uint64_t(Crafter&)>& build) {
    Crafter c;
    uint64_t root = build(c);
    return c.finish(root);
}

Bytes brokenTop(const std::function<void(plist_t)>& breakIt) {
    Crafter c;
    PlistNode top = c.top(c.addString("root"));
    breakIt(top.get());
    return toBytes(top);
}

Bytes dictionaryArchive(const char* keys, const char* values) {
    return crafted([&](Crafter& c) {
        uint64_t k = c.addString("k");
        auto refs = [&](const char* s) {
            return Crafter::uids(std::vector<uint64_t>(strlen(s), k));
        };
        return c.addObject(c.addClass("Dictionary"),
                           {{"keys", refs(keys)}, {"values", refs(values)}});
    });
}

Bytes numberArchive(uint64_t kind, PlistNode value) {
    return crafted([&](Crafter& c) {
        return c.addObject(c.addClass("Number"), {{"kind", PlistNode::unsignedInteger(kind)},
                                                  {"value", std::move(value)}});
    });
}

TEST(KeyedUnarchiverHostile, RefusesEachKindOfBadArchiveWithItsError) {
    using Set = std::set<std::string>;
    struct Case {
        Bytes bytes;
        int64_t code;
        std::string description = "";
        std::optional<Set> classes = {};
    };
    const Bytes strings = archive(Array::make({String::make("a"), String::make("b")}));
    const std::vector<Case> cases = {
        {brokenTop([](plist_t t) { plist_dict_remove_item(t, "$archiver"); }),
         int64_t(C::InvalidData)},
        {brokenTop([](plist_t t) { plist_dict_set_item(t, "$top", plist_new_string("root")); }),
         int64_t(C::InvalidData)},
        {brokenTop([](plist_t t) {
             plist_dict_set_item(plist_dict_get_item(t, "$top"), "root", plist_new_uint(1));
         }),
         int64_t(C::InvalidData)},
        {brokenTop([](plist_t t) { plist_dict_set_item(t, "$objects", plist_new_dict()); }),
         int64_t(C::InvalidData)},
        {toBytes(PlistNode::array()), int64_t(C::InvalidData)},
        {Bytes(KeyedUnarchiver::kMaxInputSize + 1, 0), int64_t(C::InputTooLarge)},
        // References, cycles and nesting.
        {crafted([](Crafter& c) { return c.addString("x") + 8; }), int64_t(C::UidOutOfRange),
         "UID 9 out of range (2 objects)"},
        {crafted([](Crafter& c) {  // UID 1 is the class description
             return c.addObject(c.addClass("Array"), {{"objects", Crafter::uids({1, 2})}});
         }),
         int64_t(C::MalformedClass)},
        {crafted([](Crafter& c) {
             return c.addObject(c.addClass("Array"), {{"objects", Crafter::uids({2})}});
         }),
         int64_t(C::ReferenceCycle), "reference cycle at object 2"},
        {crafted([](Crafter& c) {
             uint64_t array = c.addClass("Array"), dict = c.addClass("Dictionary");
             uint64_t key = c.addString("k");
             c.addObject(array, {{"objects", Crafter::uids({5})}});
             c.addObject(dict, {{"keys", Crafter::uids({key})}, {"values", Crafter::uids({4})}});
             return 4;
         }),
         int64_t(C::ReferenceCycle)},
        {arrayChain(KeyedUnarchiver::kMaxDepth), 0},
        {arrayChain(KeyedUnarchiver::kMaxDepth + 1), int64_t(C::TooDeep)},
        // Malformed objects and classes.
        {crafted([](Crafter& c) { return c.add(PlistNode::unsignedInteger(3)); }),
         int64_t(C::InvalidData)},
        {crafted([](Crafter& c) { return c.addObject(c.addString("x")); }),
         int64_t(C::MalformedClass)},
        {crafted([](Crafter& c) { return c.addObject(40); }), int64_t(C::UidOutOfRange)},
        {crafted([](Crafter& c) { return c.addObject(c.addClass("Bogus")); }),
         int64_t(C::UnknownClass)},
        {crafted([](Crafter& c) {
             return c.addObject(c.addClass("Date"), {{"time", PlistNode::string("now")}});
         }),
         int64_t(C::InvalidValue)},
        {numberArchive(9, PlistNode::unsignedInteger(1)), int64_t(C::InvalidValue)},
        {numberArchive(1, PlistNode::real(1)), int64_t(C::InvalidValue)},
        {crafted([](Crafter& c) {
             return c.addObject(c.addClass("Tag"), {{"colour", PlistNode::unsignedInteger(1)}});
         }),
         int64_t(C::InvalidValue)},
        {crafted([](Crafter& c) {  // a key that is not a string
             uint64_t n = c.addObject(c.addClass("Date"), {{"time", PlistNode::real(0)}});
             return c.addObject(c.addClass("Dictionary"),
                                {{"keys", Crafter::uids({n})}, {"values", Crafter::uids({n})}});
         }),
         int64_t(C::InvalidValue)},
        {dictionaryArchive("kk", "v"), int64_t(C::InvalidValue)},   // counts differ
        {dictionaryArchive("kk", "vv"), int64_t(C::InvalidValue)},  // a repeated key
        // Allowed classes apply to every decoded object.
        {strings, 0, "", Set{"Array", "String"}},
        {strings, int64_t(C::ClassNotAllowed), "", Set{"String"}},  // the root is checked too
        {archive(Array::make({String::make("a"), Number::fromInt64(1)})),
         int64_t(C::ClassNotAllowed), "class Number is not allowed", Set{"Array", "String"}},
        {archive(Dictionary::make({{"n", Number::fromInt64(1)}})), 0, "",
         Set{"Dictionary", "Number"}},
        {archive(Dictionary::make({{"s", String::make("v")}})), int64_t(C::ClassNotAllowed), "",
         Set{"Dictionary", "Number"}},
        // A string a Tag vouched for may not then appear where strings are not allowed.
        {crafted([](Crafter& c) {
             uint64_t label = c.addString("label");
             uint64_t tag = c.addObject(c.addClass("Tag"), {{"label", PlistNode::uid(label)}});
             return c.addObject(c.addClass("Array"), {{"objects", Crafter::uids({tag, label})}});
         }),
         int64_t(C::ClassNotAllowed), "class String is not allowed", Set{"Array", "Tag"}},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        auto [code, description] = failure(cases[i].bytes, cases[i].classes);
        EXPECT_EQ(code, cases[i].code) << "case " << i;
        EXPECT_TRUE(cases[i].description.empty() || description == cases[i].description)
            << "case " << i << ": " << description;
    }
    auto wrong = KeyedUnarchiver::unarchivedObjectOfClass<Array>(archive(nullptr));
    ASSERT_FALSE(wrong.ok());
    EXPECT_EQ(wrong.error().code(), int64_t(C::WrongClass));
}

// What the fuzzer does, deterministically and without it: cut archives fail; damaged ones either
// fail with an error or decode to something that archives again and reads back the same.
TEST(KeyedUnarchiverHostile, TruncatedAndMutatedArchivesNeverCrash) {
    auto s = String::make("s");
    const std::vector<Bytes> corpus = {
        archive(
            Array::make({s, Number::fromInt64(-2), Date::make(1.5), s,
                         Dictionary::make({{"k", Data::make({1, 2})}, {"t", Tag::make("x", 3)}})})),
        archive(Tag::make("Blue", 4)), archive(Number::fromUInt64(UINT64_MAX))};
    for (const Bytes& bytes : corpus)
        for (size_t n = 0; n < bytes.size(); ++n)
            EXPECT_EQ(failure(Bytes(bytes.begin(), bytes.begin() + ptrdiff_t(n))).first,
                      int64_t(C::InvalidData))
                << n;

    std::mt19937 random(20240607);
    const uint8_t interesting[] = {0x00, 0x01, 0x0F, 0x10, 0x13, 0x7F, 0x80, 0xAF, 0xD0, 0xFF};
    int accepted = 0;
    int refused = 0;
    for (int i = 0; i < 4000; ++i) {
        Bytes bytes = corpus[random() % corpus.size()];
        for (unsigned edits = 1 + random() % 3; edits > 0 && !bytes.empty(); --edits) {
            size_t at = random() % bytes.size();
            unsigned op = random() % 5;
            if (op == 0)
                bytes[at] ^= static_cast<uint8_t>(1u << (random() % 8));
            else if (op == 1)
                bytes[at] = interesting[random() % sizeof interesting];
            else if (op == 2)
                bytes.insert(bytes.begin() + ptrdiff_t(at), static_cast<uint8_t>(random()));
            else if (op == 3)
                bytes.erase(bytes.begin() + ptrdiff_t(at));
            else
                bytes[at] = static_cast<uint8_t>(bytes[at] + 1);
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

TEST(KeyedUnarchiverHostile, SharingLikeBillionLaughsStaysLinearAndShared) {
    ObjectRef level = String::make("lol");
    for (int i = 0; i < 200; ++i) level = Array::make({level, level, level});
    Bytes bytes = archive(level);
    EXPECT_LT(bytes.size(), 20000u);
    auto decoded = objectCast<Array>(KeyedUnarchiver::unarchiveObjectWithData(bytes).value());
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->objects()[0], decoded->objects()[2]);
    EXPECT_EQ(archive(decoded), bytes);
}

// Same kind and value; unlike isEqual, tells -0.0 from 0.0 and takes NaN for NaN.
bool sameNumber(const Number& a, const Number& b) {
    if (a.kind() != b.kind())
        return false;
    if (a.kind() != Number::Kind::Floating)
        return a.uint64Value() == b.uint64Value();
    double x = a.doubleValue(), y = b.doubleValue();
    return std::signbit(x) == std::signbit(y) && (x == y || (std::isnan(x) && std::isnan(y)));
}

class Unregistered : public Object {
public:
    std::string_view className() const override { return "Unregistered"; }
    std::string description() const override { return {}; }
    bool isEqual(const Object&) const override { return false; }
};

ObjectRef nestedArrays(size_t depth) {
    ObjectRef object = String::make("core");
    for (size_t i = 0; i < depth; ++i) object = Array::make({object});
    return object;
}

TEST(KeyedArchiveRoundTrip, EveryValueKindComesBackExactlyOrIsRefusedWhenWritten) {
    Bytes allBytes;
    for (int i = 0; i < 256; ++i) allBytes.push_back(static_cast<uint8_t>(i));
    std::vector<ObjectRef> values = {String::make(""),
                                     String::make("h\xC3\xA9llo \xE2\x82\xAC \xF0\x9F\x98\x80"),
                                     String::make(std::string(70000, 'x')),
                                     Data::make({}),
                                     Data::make(allBytes),
                                     Tag::make("Rot \xF0\x9F\x94\xB4", 6),
                                     Tag::make("", -3)};
    values.push_back(
        Array::make({Dictionary::make({{"", Number::fromInt64(-7)},
                                       {"list", Array::make({String::make("a"), nullptr})},
                                       {"\xC3\xA9t\xC3\xA9", Date::make(12.5)},
                                       {"empty", Dictionary::make({})}}),
                     Array::make({}), Tag::make("Work", 2), nullptr}));
    for (int64_t v : {std::numeric_limits<int64_t>::min(), int64_t{-1}, INT64_MAX})
        values.push_back(Number::fromInt64(v));
    for (uint64_t v : {uint64_t{0}, uint64_t{1} << 63, UINT64_MAX})
        values.push_back(Number::fromUInt64(v));
    for (double v : {0.1, -0.0, 1e300, std::numeric_limits<double>::infinity(), std::nan("")})
        values.push_back(Number::fromDouble(v));
    for (bool v : {true, false}) values.push_back(Number::fromBool(v));
    for (double t : {-1.25, 1700000000.123456, -62135596800.5, 1e-9})
        values.push_back(Date::make(t));
    for (size_t i = 0; i < values.size(); ++i) {
        auto decoded = KeyedUnarchiver::unarchiveObjectWithData(archive(values[i]));
        ASSERT_TRUE(decoded.ok() && *decoded) << i;
        EXPECT_EQ((*decoded)->className(), values[i]->className()) << i;
        auto number = objectCast<Number>(values[i]);
        EXPECT_TRUE(number ? sameNumber(*number, *objectCast<Number>(*decoded))
                           : values[i]->isEqual(**decoded))
            << i;
    }
    EXPECT_EQ(KeyedUnarchiver::unarchiveObjectWithData(archive(nullptr)).value(), nullptr);

    // What could not be read back is refused when written.
    const std::pair<ObjectRef, C> refused[] = {
        {Array::make({std::make_shared<Unregistered>()}), C::UnregisteredClass},
        {String::make(std::string("a\0b", 3)), C::UnencodableValue},
        {Tag::make("bad \xFF", 0), C::UnencodableValue},
        {nestedArrays(KeyedUnarchiver::kMaxDepth), C::TooDeep},
    };
    for (const auto& [object, code] : refused) {
        auto r = KeyedArchiver::archivedDataWithRootObject(object);
        ASSERT_FALSE(r.ok()) << int64_t(code);
        EXPECT_TRUE(r.error().is(kArchiveErrorDomain, int64_t(code)));
    }
    EXPECT_EQ(failure(archive(nestedArrays(KeyedUnarchiver::kMaxDepth - 1))).first, 0);
}

// A date that is no point in time (found by fuzzing the metadata attributes): NaN equals nothing,
// itself included, so a record holding one never reads the same twice.
TEST(KeyedUnarchiverHostile, ADateThatIsNoPointInTimeIsRefused) {
    // The time is written as a 4-byte float when it fits one, else as an 8-byte double.
    for (double time : {1.5, 1700000000.123456}) {
        Bytes bytes = archive(Date::make(time));
        float single = float(time);
        uint8_t pattern[8];
        size_t size = single == time ? 4 : 8;
        uint64_t bits = 0;
        if (size == 4)
            std::memcpy(&bits, &single, 4);
        else
            std::memcpy(&bits, &time, 8);
        for (size_t k = 0; k < size; ++k) pattern[k] = uint8_t(bits >> (8 * (size - 1 - k)));
        auto at = std::search(bytes.begin(), bytes.end(), pattern, pattern + size);
        ASSERT_NE(at, bytes.end()) << time;
        for (double bad : {std::nan(""), -std::numeric_limits<double>::infinity()}) {
            float badSingle = float(bad);
            uint64_t badBits = 0;
            if (size == 4)
                std::memcpy(&badBits, &badSingle, 4);
            else
                std::memcpy(&badBits, &bad, 8);
            for (size_t k = 0; k < size; ++k) *(at + k) = uint8_t(badBits >> (8 * (size - 1 - k)));
            auto decoded = KeyedUnarchiver::unarchiveObjectWithData(bytes);
            EXPECT_FALSE(decoded.ok() && *decoded) << time << " made " << bad;
        }
    }
}

TEST(KeyedArchiveRoundTrip, RegistryServesReadersWhileAnotherLayerRegisters) {
    Bytes bytes = archive(Array::make({Tag::make("t", 1), Number::fromInt64(2)}));
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 300; ++i) {
                std::string name = "Concurrent" + std::to_string(i);
                if (t == 0)
                    ArchiveClassRegistry::shared().add(
                        {name,
                         {name},
                         [](const Object&, KeyedArchiver&) {},
                         [](KeyedUnarchiver&) { return ObjectRef(); }});
                else
                    failures += !KeyedUnarchiver::unarchiveObjectWithData(bytes).ok();
            }
        });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(failures, 0);
    auto added = ArchiveClassRegistry::shared().find("Concurrent299");
    ASSERT_TRUE(added);
    EXPECT_EQ(added->hierarchy, (std::vector<std::string>{"Concurrent299", "Object"}));
}

std::string rejection(const Bytes& bytes) {
    auto error = BinaryPlistValidator::validate(bytes.data(), bytes.size(),
                                                BinaryPlistValidator::limitsForSize(bytes.size()));
    return !error.ok() ? error.error().userInfo().at("description") : "";
}

// Each object but the last is an array referring `fanOut` times to the next one.
Bytes chain(size_t length, size_t fanOut) {
    std::vector<Bytes> objects;
    for (size_t i = 0; i + 1 < length; ++i)
        objects.push_back(rawArray(std::vector<uint64_t>(fanOut, i + 1)));
    objects.push_back(rawArray({}));
    return rawBinaryPlist(objects, 0);
}

// libplist 2.2 overflows its stack on the first and needs 2^60 nodes for the second; both must
// be refused before it sees them, by every reader.
TEST(BinaryPlistValidator, RefusesWhatLibplistCannotParseSafely) {
    for (const Bytes& bytes : {chain(100000, 1), chain(60, 2)}) {
        EXPECT_FALSE(KeyedUnarchiver::unarchiveObjectWithData(bytes).ok());
        EXPECT_FALSE(GetTagsFromTagsData(bytes).has_value());
    }
    EXPECT_EQ(rejection(chain(100000, 1)), "objects nested deeper than 64 levels");
    EXPECT_EQ(rejection(chain(60, 2)).rfind("expands to more than", 0), 0u);
    EXPECT_EQ(rejection(chain(3, 2)), "");
    EXPECT_EQ(rejection(rawBinaryPlist({rawArray({1}), rawArray({0})}, 0)),
              "object 0 contains itself");
}

TEST(BinaryPlistValidator, RefusesDamagedStructure) {
    Bytes good = rawBinaryPlist({rawArray({1, 1}), {0x51, 'x'}}, 0);
    ASSERT_EQ(rejection(good), "");
    const size_t trailer = good.size() - 32;
    const std::pair<size_t, std::vector<uint8_t>> damages[] = {
        {trailer + 6, {9}},                             // offset width
        {trailer + 7, {0}},                             // reference width
        {trailer + 15, {0}},                            // no objects
        {trailer + 23, {2}},                            // root out of range
        {trailer + 24, {0x7F}},                         // offset table out of range
        {trailer + 15, {0xFF}},                         // offset table cut off
        {trailer - 1, {0x30}},                          // object offset into the table
        {8, {0xAF, 0x13, 0, 0, 0, 1, 0, 0, 0, 0}},      // array claiming 2^32 entries
        {12, {2}},                                      // reference past the last object
        {17, {0x70}},                                   // unknown marker
        {17, {0x00}},                                   // null
        {17, {0x15}},                                   // 32-byte integer
        {17, {0x4F, 0x13, 0x40, 0, 0, 0, 0, 0, 0, 0}},  // data claiming 2^62 bytes
        {0, {'b', 'p', 'l', 'i', 's', 't', '1', '5'}},  // another format
    };
    for (const auto& [at, patch] : damages) {
        Bytes bytes = good;
        bytes.resize(std::max(bytes.size(), at + patch.size()));
        std::copy(patch.begin(), patch.end(), bytes.begin() + ptrdiff_t(at));
        EXPECT_NE(rejection(bytes), "") << at;
    }
    PlistNode dictionary = PlistNode::dictionary();
    PlistNode::set(dictionary.get(), "k", PlistNode::unsignedInteger(1));
    Bytes bytes = toBytes(dictionary);
    ASSERT_EQ(rejection(bytes), "");
    bytes[11] = 0x10;  // the key "k" becomes the integer 'k'
    EXPECT_EQ(rejection(bytes), "dictionary 0 has a key that is not a string");
}

TEST(TagData, RoundTripsInOrderSkipsBadEntriesAndRefusesOtherData) {
    std::vector<std::shared_ptr<const Tag>> tags = {Tag::make("Red", 6), Tag::make("\u00DCber", 0),
                                                    Tag::make("Neg", -2), Tag::make("Red", 1)};
    auto decoded = GetTagsFromTagsData(GetTagsDataForTags(tags));
    ASSERT_TRUE(decoded);
    ASSERT_EQ(decoded->size(), tags.size());
    for (size_t i = 0; i < tags.size(); ++i) EXPECT_TRUE(tags[i]->isEqual(*(*decoded)[i])) << i;
    EXPECT_TRUE(GetTagsFromTagsData(GetTagsDataForTags({})).value_or(tags).empty());

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
    entry(PlistNode::unsignedInteger(5), PlistNode::unsignedInteger(2));
    PlistNode::append(list.get(), PlistNode::string("not a dictionary"));
    entry(PlistNode::string("Green"), PlistNode::unsignedInteger(2));
    auto kept = GetTagsFromTagsData(toBytes(list));
    ASSERT_TRUE(kept);
    ASSERT_EQ(kept->size(), 2u);
    EXPECT_TRUE((*kept)[0]->isEqual(*Tag::make("Plain", 0)));
    EXPECT_TRUE((*kept)[1]->isEqual(*Tag::make("Green", 2)));

    Bytes valid = GetTagsDataForTags({Tag::make("Red", 6)});
    EXPECT_FALSE(GetTagsFromTagsData({}));
    EXPECT_FALSE(GetTagsFromTagsData(Bytes(valid.begin(), valid.end() - 1)));
    EXPECT_FALSE(GetTagsFromTagsData(toBytes(PlistNode::dictionary())));
    EXPECT_FALSE(GetTagsFromTagsData(Bytes{'<', '?', 'x', 'm', 'l'}));
}

}  // namespace
}  // namespace tamber
