#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "host/HostPorterItemIdentifier.h"

namespace tamber {

// A HostPorterItemIdentifier taken apart once: the host keeps the string, the program asks
// this what it names. Anything that is not exactly one of the forms is Invalid, so that a
// hostile string ("fid=1x", "#", a number out of range, an embedded NUL) names nothing rather
// than the item of some prefix of it.
class ItemIdentifier {
public:
    enum class Kind {
        Invalid,
        RootContainer,
        WorkingSet,
        AllDirectories,
        TemporaryFolder,
        File,        // "fid=N": N a file ID, decimal digits only (no leading zero), in range
                     // of 64 bits
        Document,    // "did=N": N a document ID, likewise
        AppLibrary,  // "#" and a non-empty bundle identifier without NUL
    };

    static ItemIdentifier parse(std::string_view identifier);

    Kind kind() const { return kind_; }
    bool isValid() const { return kind_ != Kind::Invalid; }
    // One of the four fixed container identifiers.
    bool isContainer() const;
    bool isAppLibrary() const { return kind_ == Kind::AppLibrary; }
    // The file ID or document ID; 0 for the other kinds.
    uint64_t number() const { return number_; }
    // The app's bundle identifier; empty for the other kinds.
    const std::string& bundleIdentifier() const { return bundle_; }

private:
    Kind kind_ = Kind::Invalid;
    uint64_t number_ = 0;
    std::string bundle_;
};

}  // namespace tamber
