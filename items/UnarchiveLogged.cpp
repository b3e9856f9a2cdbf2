#include "items/UnarchiveLogged.h"

#include "items/UnarchiveError.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "support/Log.h"

namespace tamber {

template <class T>
std::shared_ptr<const T> UnarchiveLogged(const Bytes& data) {
    if (data.empty())
        return nullptr;
    Error error;
    auto root = KeyedUnarchiver::unarchiveObjectWithData(data);
    if (root.ok()) {
        if (auto typed = objectCast<T>(root.value()))
            return typed;
        error = makeError(UnarchiveError::invalidResultingClass);
    } else {
        error = root.error();
    }
    logError("got " + error.description() + " while unarchiving object from " +
             describeBytes(data));
    return nullptr;
}

template std::shared_ptr<const Date> UnarchiveLogged<Date>(const Bytes&);
template std::shared_ptr<const Dictionary> UnarchiveLogged<Dictionary>(const Bytes&);

}  // namespace tamber
