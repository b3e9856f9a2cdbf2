#include "platform/objects/String.h"

namespace tamber {

std::shared_ptr<const String> String::make(std::string value) {
    return std::make_shared<const String>(std::move(value));
}

bool String::isEqual(const Object& other) const {
    auto s = dynamic_cast<const String*>(&other);
    return s && s->value_ == value_;
}

}  // namespace tamber
