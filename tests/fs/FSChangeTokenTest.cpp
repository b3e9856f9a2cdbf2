#include <gtest/gtest.h>

#include <cstdint>
#include <random>

#include "fs/FSChangeToken.h"
#include "platform/archive/PlistNode.h"

namespace tamber {
namespace {

constexpr const char* kUUID = "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9";

Bytes plistBytes(const std::function<void(plist_t)>& fill) {
    PlistNode dictionary = PlistNode::dictionary();
    fill(dictionary.get());
    return dictionary.toBinary().value();
}

void setAll(plist_t d) {
    PlistNode::set(d, "version", PlistNode::unsignedInteger(0));
    PlistNode::set(d, "deviceUUID", PlistNode::string(kUUID));
    PlistNode::set(d, "streamEventID", PlistNode::unsignedInteger(12));
    PlistNode::set(d, "offset", PlistNode::unsignedInteger(200));
    PlistNode::set(d, "appLibraryVersionToken", PlistNode::unsignedInteger(3));
}

TEST(FSChangeTokenTest, RoundTripsExtremesAndEncodesDeterministically) {
    FSChangeToken max{UINT64_MAX, kUUID, UINT64_MAX, UINT64_MAX, UINT64_MAX};
    auto decoded = FSChangeToken::decode(max.encode());
    ASSERT_TRUE(decoded);
    EXPECT_EQ(*decoded, max);

    FSChangeToken token{0, kUUID, 12, 200, 3};
    EXPECT_EQ(token.encode(), token.encode());
    EXPECT_EQ(token.encode(), FSChangeToken(token).encode());
    EXPECT_EQ(FSChangeToken::decode(token.encode()), token);
    // A token written by another writer with the same content reads the same.
    EXPECT_EQ(FSChangeToken::decode(plistBytes(setAll)), token);
    EXPECT_NE(token.encode(), (FSChangeToken{0, kUUID, 12, 201, 3}.encode()));
    EXPECT_EQ(token.description(),
              std::string("<FSChangeToken v:0 uuid:") + kUUID + " id:12 offset:200 apps:3>");

    // UUIDs are kept in their canonical upper-case form.
    FSChangeToken lower{0, "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9", 1, 0, 0};
    EXPECT_EQ(FSChangeToken::decode(lower.encode())->deviceUUID, kUUID);
}

TEST(FSChangeTokenTest, RefusesAnythingButAWholeToken) {
    EXPECT_FALSE(FSChangeToken::decode({}));
    EXPECT_FALSE(FSChangeToken::decode({'b', 'p', 'l', 'i', 's', 't', '0', '0'}));
    std::mt19937 random(7);
    for (int i = 0; i < 200; ++i) {
        Bytes bytes(1 + random() % 96);
        for (auto& b : bytes) b = static_cast<uint8_t>(random());
        EXPECT_FALSE(FSChangeToken::decode(bytes));
    }
    // Damaged copies of a real token: never a crash, and never a different token.
    FSChangeToken token{0, kUUID, 12, 200, 3};
    Bytes good = token.encode();
    for (size_t i = 0; i < good.size(); ++i) {
        Bytes bad = good;
        bad[i] ^= 0x5A;
        auto decoded = FSChangeToken::decode(bad);
        // Whatever still decodes is a whole token that survives another round trip.
        if (decoded) {
            EXPECT_EQ(FSChangeToken::decode(decoded->encode()), decoded) << i;
        }
        Bytes truncated(good.begin(), good.begin() + static_cast<long>(i));
        EXPECT_FALSE(FSChangeToken::decode(truncated)) << i;
    }

    for (const char* key :
         {"version", "deviceUUID", "streamEventID", "offset", "appLibraryVersionToken"}) {
        EXPECT_FALSE(FSChangeToken::decode(plistBytes([&](plist_t d) {
            setAll(d);
            plist_dict_remove_item(d, key);
        }))) << "without "
             << key;
        EXPECT_FALSE(FSChangeToken::decode(plistBytes([&](plist_t d) {
            setAll(d);
            PlistNode::set(d, key, PlistNode::real(1.0));
        }))) << key
             << " as a real";
    }
    // Keys are matched exactly.
    EXPECT_FALSE(FSChangeToken::decode(plistBytes([](plist_t d) {
        setAll(d);
        plist_dict_remove_item(d, "offset");
        PlistNode::set(d, "Offset", PlistNode::unsignedInteger(200));
    })));
    for (const char* uuid :
         {"", "not-a-uuid", "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F",
          "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8FG", "0A1B2C3D04E5F-6071-8293-A4B5C6D7E8F9"}) {
        EXPECT_FALSE(FSChangeToken::decode(plistBytes([&](plist_t d) {
            setAll(d);
            PlistNode::set(d, "deviceUUID", PlistNode::string(uuid));
        }))) << uuid;
    }
    // The top level must be the dictionary itself.
    PlistNode array = PlistNode::array();
    PlistNode::append(array.get(), PlistNode::unsignedInteger(1));
    EXPECT_FALSE(FSChangeToken::decode(array.toBinary().value()));
}

}  // namespace
}  // namespace tamber
