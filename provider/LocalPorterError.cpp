#include "provider/LocalPorterError.h"

namespace tamber {

std::string_view localPorterErrorName(LocalPorterError error) {
    switch (error) {
        case LocalPorterError::invalidItemIdentifier:
            return "invalidItemIdentifier";
        case LocalPorterError::invalidItemURL:
            return "invalidItemURL";
        case LocalPorterError::itemNotFound:
            return "itemNotFound";
        case LocalPorterError::unableToGetDeviceUUID:
            return "unableToGetDeviceUUID";
    }
    return "unknown";
}

namespace {

// What a person reads: the case's name alone says little outside the code.
std::string_view reasonOf(LocalPorterError error) {
    switch (error) {
        case LocalPorterError::invalidItemIdentifier:
        case LocalPorterError::itemNotFound:
            return "no such item";
        case LocalPorterError::invalidItemURL:
            return "no library or folder to put the item in";
        case LocalPorterError::unableToGetDeviceUUID:
            return "can't identify the volume (its event journal has no identifier)";
    }
    return "the provider failed";
}

}  // namespace

Error makeLocalPorterError(LocalPorterError error, const std::string& subject) {
    std::string description(reasonOf(error));
    if (!subject.empty())
        description += ": " + subject;
    return Error(
        kLocalPorterErrorDomain, static_cast<int64_t>(error),
        {{"description", description}, {"case", std::string(localPorterErrorName(error))}});
}

}  // namespace tamber
