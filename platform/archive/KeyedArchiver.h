#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

#include "platform/objects/Data.h"
#include "platform/objects/Object.h"
#include "support/Result.h"

namespace tamber {

// Writes an object graph as a keyed archive: a binary property list
// {"$archiver": "KeyedArchiver", "$version": 100000, "$top": {"root": UID}, "$objects": [...]}.
// "$objects"[0] is "$null"; strings and data are stored as plain scalars; every other object is
// a dictionary whose "$class" UID names a {"$classname", "$classes"} description. An object
// that appears twice is stored once.
class KeyedArchiver {
public:
    // Fails with a KeyedArchiveErrorDomain error when the graph holds an object whose class is
    // not registered for archiving.
    static Result<Bytes> archivedDataWithRootObject(const ObjectRef& root);

    // For the encoders of archivable classes (see ArchiveClassRegistry).
    void encodeObject(const ObjectRef& object, std::string_view key);
    void encodeInt64(int64_t value, std::string_view key);
    void encodeUInt64(uint64_t value, std::string_view key);
    void encodeDouble(double value, std::string_view key);
    void encodeBool(bool value, std::string_view key);
    // An array of object references (what Array uses).
    void encodeObjects(const std::vector<ObjectRef>& objects, std::string_view key);
    // Stops the archive: archivedDataWithRootObject returns the first error reported.
    void failWithError(Error error);

    class Impl;
    explicit KeyedArchiver(Impl& impl) : impl_(impl) {}

private:
    Impl& impl_;
};

}  // namespace tamber
