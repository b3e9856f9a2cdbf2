#include "fs/FSChangeToken.h"

#include "fs/CanonicalUUID.h"
#include "platform/archive/PlistNode.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr const char* kVersionKey = "version";
constexpr const char* kDeviceUUIDKey = "deviceUUID";
constexpr const char* kStreamEventIDKey = "streamEventID";
constexpr const char* kOffsetKey = "offset";
constexpr const char* kAppLibraryVersionTokenKey = "appLibraryVersionToken";

// An anchor is five small fields; anything much larger was not written by us.
constexpr size_t kMaxAnchorSize = 64 * 1024;

}  // namespace

Bytes FSChangeToken::encode() const {
    // Keys are always inserted in the same order, so equal tokens give equal bytes.
    PlistNode dictionary = PlistNode::dictionary();
    PlistNode::set(dictionary.get(), kVersionKey, PlistNode::unsignedInteger(version));
    // A text that is no UUID is written as nothing: the token then fails to decode, as it must.
    std::string uuid = canonicalUUIDText(deviceUUID).value_or(std::string());
    PlistNode::set(dictionary.get(), kDeviceUUIDKey, PlistNode::string(uuid));
    PlistNode::set(dictionary.get(), kStreamEventIDKey, PlistNode::unsignedInteger(streamEventID));
    PlistNode::set(dictionary.get(), kOffsetKey, PlistNode::unsignedInteger(offset));
    PlistNode::set(dictionary.get(), kAppLibraryVersionTokenKey,
                   PlistNode::unsignedInteger(appLibraryVersionToken));
    auto bytes = dictionary.toBinary();
    if (!bytes.ok())
        fatalError("can't encode change token; " + bytes.error().description());
    return std::move(bytes).value();
}

std::optional<FSChangeToken> FSChangeToken::decode(const Bytes& bytes) {
    // The validator runs inside fromBinary, before libplist sees the bytes.
    auto root = PlistNode::fromBinary(bytes, kMaxAnchorSize);
    if (!root.ok() || !PlistNode::isType(root.value().get(), PLIST_DICT))
        return std::nullopt;
    plist_t dictionary = root.value().get();
    auto version = PlistNode::unsignedValue(PlistNode::member(dictionary, kVersionKey));
    auto uuid = PlistNode::stringValue(PlistNode::member(dictionary, kDeviceUUIDKey));
    auto eventID = PlistNode::unsignedValue(PlistNode::member(dictionary, kStreamEventIDKey));
    auto offset = PlistNode::unsignedValue(PlistNode::member(dictionary, kOffsetKey));
    auto apps = PlistNode::unsignedValue(PlistNode::member(dictionary, kAppLibraryVersionTokenKey));
    if (!version || !uuid || !eventID || !offset || !apps)
        return std::nullopt;
    auto canonical = canonicalUUIDText(*uuid);
    if (!canonical)
        return std::nullopt;
    return FSChangeToken{*version, *canonical, *eventID, *offset, *apps};
}

std::string FSChangeToken::description() const {
    return "<FSChangeToken v:" + std::to_string(version) + " uuid:" + deviceUUID +
           " id:" + std::to_string(streamEventID) + " offset:" + std::to_string(offset) +
           " apps:" + std::to_string(appLibraryVersionToken) + ">";
}

}  // namespace tamber
