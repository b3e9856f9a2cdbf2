#include "platform/Tag.h"

namespace tamber {

std::shared_ptr<const Tag> Tag::make(std::string label, int64_t colour) {
    return std::make_shared<const Tag>(std::move(label), colour);
}

std::string Tag::description() const {
    return "<Tag label:\"" + label_ + "\" colour:" + std::to_string(colour_) + ">";
}

bool Tag::isEqual(const Object& other) const {
    auto t = dynamic_cast<const Tag*>(&other);
    return t && t->label_ == label_ && t->colour_ == colour_;
}

}  // namespace tamber
