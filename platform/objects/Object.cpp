#include "platform/objects/Object.h"

namespace tamber {

bool objectsEqual(const ObjectRef& a, const ObjectRef& b) {
    if (a == b)
        return true;
    if (!a || !b)
        return false;
    return a->isEqual(*b);
}

}  // namespace tamber
