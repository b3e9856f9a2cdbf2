#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"

namespace tamber {

// How one class is written to and read from a keyed archive. The built-in classes (Date,
// Number, Array, Dictionary, Tag; String and Data are scalars) are registered from the start;
// other layers register theirs (BundleRecord) once, before first use.
struct ArchiveClass {
    std::string name;
    // "$classes" of the class description, most derived first (defaults to {name, "Object"}).
    std::vector<std::string> hierarchy;
    std::function<void(const Object&, KeyedArchiver&)> encode;
    // Null (or failWithError on the unarchiver) when the fields are not right.
    std::function<ObjectRef(KeyedUnarchiver&)> decode;
};

class ArchiveClassRegistry {
public:
    static ArchiveClassRegistry& shared();
    void add(ArchiveClass archiveClass);
    // A copy, so that callers never hold a reference into a map another thread may change.
    std::optional<ArchiveClass> find(std::string_view name) const;

private:
    ArchiveClassRegistry();
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace tamber
