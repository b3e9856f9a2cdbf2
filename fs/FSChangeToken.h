#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/objects/Data.h"

namespace tamber {

// Where change enumeration stands: the content of every sync anchor and page token. Encoded
// as a binary property list (a dictionary with the five keys "version", "deviceUUID",
// "streamEventID", "offset" and "appLibraryVersionToken"); decoding is strict, so that a
// damaged or foreign anchor is refused whole and never half-used.
struct FSChangeToken {
    uint64_t version = 0;
    // The event-store UUID of the volume, in canonical upper-case text form.
    std::string deviceUUID;
    uint64_t streamEventID = 0;
    uint64_t offset = 0;
    uint64_t appLibraryVersionToken = 0;

    // The same token always encodes to the same bytes.
    Bytes encode() const;
    // Nothing when the bytes are not a property list, a key is missing or has the wrong type,
    // or the UUID is not a UUID.
    static std::optional<FSChangeToken> decode(const Bytes& bytes);

    // "<FSChangeToken v:0 uuid:... id:12 offset:200 apps:3>", for log lines.
    std::string description() const;

    friend bool operator==(const FSChangeToken&, const FSChangeToken&) = default;
};

}  // namespace tamber
