#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace tamber {

// A dynamically typed, immutable value: what keyed archives hold and what URL resource values
// are. Shared by `ObjectRef`; concrete classes are Date, String, Number, Data, Array,
// Dictionary, Tag (and later BundleRecord).
class Object {
public:
    virtual ~Object() = default;
    // The archive class name ("Date", "String", ...).
    virtual std::string_view className() const = 0;
    virtual std::string description() const = 0;
    virtual bool isEqual(const Object& other) const = 0;
};

using ObjectRef = std::shared_ptr<const Object>;

// Checked downcast; null when `object` is null or of another class.
template <class T>
std::shared_ptr<const T> objectCast(const ObjectRef& object) {
    return std::dynamic_pointer_cast<const T>(object);
}

bool objectsEqual(const ObjectRef& a, const ObjectRef& b);

}  // namespace tamber
