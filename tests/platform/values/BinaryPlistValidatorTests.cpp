#include <gtest/gtest.h>

#include "platform/Tag.h"
#include "platform/archive/BinaryPlistValidator.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "tests/platform/values/ArchiveCrafter.h"

namespace tamber {
namespace {

using testing::ArchiveCrafter;

std::string rejection(const Bytes& bytes) {
    auto error = BinaryPlistValidator::validate(bytes.data(), bytes.size(),
                                                BinaryPlistValidator::limitsForSize(bytes.size()));
    return error ? error->userInfo().at("description") : "";
}

// Each object but the last is an array referring `fanOut` times to the next one.
Bytes chain(size_t length, size_t fanOut) {
    std::vector<Bytes> objects;
    for (size_t i = 0; i + 1 < length; ++i)
        objects.push_back(ArchiveCrafter::rawArray(std::vector<uint64_t>(fanOut, i + 1)));
    objects.push_back(ArchiveCrafter::rawArray({}));
    return ArchiveCrafter::rawBinaryPlist(objects, 0);
}

// libplist 2.2 overflows its stack on the first and needs 2^60 nodes for the second; both must
// be refused before it sees them, by every reader.
TEST(BinaryPlistValidator, RefusesWhatLibplistCannotParseSafely) {
    for (const Bytes& bytes : {chain(100000, 1), chain(60, 2)}) {
        EXPECT_NE(rejection(bytes), "");
        EXPECT_FALSE(KeyedUnarchiver::unarchiveObjectWithData(bytes).ok());
        EXPECT_FALSE(GetTagsFromTagsData(bytes).has_value());
    }
    EXPECT_EQ(rejection(chain(100000, 1)), "objects nested deeper than 64 levels");
    EXPECT_EQ(rejection(chain(60, 2)).rfind("expands to more than", 0), 0u);
    EXPECT_EQ(rejection(chain(3, 2)), "");
    EXPECT_EQ(rejection(ArchiveCrafter::rawBinaryPlist(
                  {ArchiveCrafter::rawArray({1}), ArchiveCrafter::rawArray({0})}, 0)),
              "object 0 contains itself");
}

TEST(BinaryPlistValidator, RefusesDamagedStructure) {
    Bytes good = ArchiveCrafter::rawBinaryPlist({ArchiveCrafter::rawArray({1, 1}), {0x51, 'x'}}, 0);
    ASSERT_EQ(rejection(good), "");
    const size_t trailer = good.size() - 32;
    struct Damage {
        size_t at;
        std::vector<uint8_t> bytes;
    };
    const std::vector<Damage> damages = {
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
    for (const auto& damage : damages) {
        Bytes bytes = good;
        if (damage.at + damage.bytes.size() > bytes.size())
            bytes.resize(damage.at + damage.bytes.size());
        std::copy(damage.bytes.begin(), damage.bytes.end(),
                  bytes.begin() + static_cast<ptrdiff_t>(damage.at));
        EXPECT_NE(rejection(bytes), "") << damage.at;
    }
    PlistNode dictionary = PlistNode::dictionary();
    PlistNode::set(dictionary.get(), "k", PlistNode::unsignedInteger(1));
    Bytes bytes = ArchiveCrafter::toBytes(dictionary);
    ASSERT_EQ(rejection(bytes), "");
    bytes[11] = 0x10;  // the key "k" becomes the integer 'k'
    EXPECT_EQ(rejection(bytes), "dictionary 0 has a key that is not a string");
}

}  // namespace
}  // namespace tamber
