#include "platform/objects/Array.h"

namespace tamber {

std::shared_ptr<const Array> Array::make(std::vector<ObjectRef> objects) {
    return std::make_shared<const Array>(std::move(objects));
}

std::string Array::description() const {
    std::string out = "(";
    for (size_t i = 0; i < objects_.size(); ++i) {
        if (i)
            out += ", ";
        out += objects_[i] ? objects_[i]->description() : "null";
    }
    return out + ")";
}

bool Array::isEqual(const Object& other) const {
    auto a = dynamic_cast<const Array*>(&other);
    if (!a || a->objects_.size() != objects_.size())
        return false;
    for (size_t i = 0; i < objects_.size(); ++i)
        if (!objectsEqual(objects_[i], a->objects_[i]))
            return false;
    return true;
}

}  // namespace tamber
