// Feeds arbitrary bytes to the keyed unarchiver, unrestricted and with a restricted class set.
// Whatever decodes must archive again, and that archive must read back to the same archive.
#include <cstdint>
#include <cstdlib>

#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"

using namespace tamber;

namespace {

void check(bool condition) {
    if (!condition)
        std::abort();
}

void roundTrip(const ObjectRef& object) {
    auto archived = KeyedArchiver::archivedDataWithRootObject(object);
    check(archived.ok());
    auto reread = KeyedUnarchiver::unarchiveObjectWithData(*archived);
    check(reread.ok());
    auto again = KeyedArchiver::archivedDataWithRootObject(*reread);
    check(again.ok() && *again == *archived);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Bytes bytes(data, data + size);
    auto any = KeyedUnarchiver::unarchiveObjectWithData(bytes);
    if (any.ok())
        roundTrip(*any);
    auto restricted =
        KeyedUnarchiver::unarchivedObjectOfClasses({"Array", "String", "Number"}, bytes);
    // A restricted read accepts a subset of what an unrestricted one does.
    check(!restricted.ok() || any.ok());
    if (restricted.ok())
        roundTrip(*restricted);
    return 0;
}
