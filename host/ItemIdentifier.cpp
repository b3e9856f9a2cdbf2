#include "host/ItemIdentifier.h"

#include <charconv>

namespace tamber {

namespace {

// The whole of `digits` as a number: no sign, no space, no trailing text, no overflow, and no
// leading zero ("fid=04" would be a second identifier for the item "fid=4").
bool parseNumber(std::string_view digits, uint64_t& value) {
    if (digits.empty() || digits.front() < '0' || digits.front() > '9')
        return false;
    if (digits.size() > 1 && digits.front() == '0')
        return false;
    auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), value);
    return ec == std::errc() && end == digits.data() + digits.size();
}

}  // namespace

ItemIdentifier ItemIdentifier::parse(std::string_view identifier) {
    ItemIdentifier parsed;
    if (identifier == HostPorterRootContainerItemIdentifier) {
        parsed.kind_ = Kind::RootContainer;
    } else if (identifier == HostPorterWorkingSetContainerItemIdentifier) {
        parsed.kind_ = Kind::WorkingSet;
    } else if (identifier == HostPorterAllDirectoriesContainerItemIdentifier) {
        parsed.kind_ = Kind::AllDirectories;
    } else if (identifier == HostPorterTemporaryLocalFolderItemIdentifier) {
        parsed.kind_ = Kind::TemporaryFolder;
    } else if (identifier.starts_with("fid=") || identifier.starts_with("did=")) {
        // Into a local: a number read from a prefix ("1" of "1x") must not stay behind.
        uint64_t number = 0;
        if (parseNumber(identifier.substr(4), number)) {
            parsed.kind_ = identifier.front() == 'f' ? Kind::File : Kind::Document;
            parsed.number_ = number;
        }
    } else if (identifier.size() > 1 && identifier.front() == '#' &&
               identifier.find('\0') == std::string_view::npos) {
        parsed.kind_ = Kind::AppLibrary;
        parsed.bundle_ = std::string(identifier.substr(1));
    }
    return parsed;
}

bool ItemIdentifier::isContainer() const {
    return kind_ == Kind::RootContainer || kind_ == Kind::WorkingSet ||
           kind_ == Kind::AllDirectories || kind_ == Kind::TemporaryFolder;
}

}  // namespace tamber
