#include "provider/LocalPorterError.h"

#include <string>

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

Error makeLocalPorterError(LocalPorterError error) {
    return Error(kLocalPorterErrorDomain, static_cast<int64_t>(error),
                 {{"description", std::string(localPorterErrorName(error))}});
}

}  // namespace tamber
