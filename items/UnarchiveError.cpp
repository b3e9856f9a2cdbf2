#include "items/UnarchiveError.h"

namespace tamber {

Error makeError(UnarchiveError error) {
    switch (error) {
        case UnarchiveError::invalidResultingClass:
            return Error(kUnarchiveErrorDomain, 0,
                         {{"description", "UnarchiveError.invalidResultingClass"}});
    }
    return Error(kUnarchiveErrorDomain, -1);
}

}  // namespace tamber
