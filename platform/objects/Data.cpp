#include "platform/objects/Data.h"

#include <cstdio>

namespace tamber {

std::shared_ptr<const Data> Data::make(Bytes bytes) {
    return std::make_shared<const Data>(std::move(bytes));
}

std::string describeBytes(const Bytes& bytes) {
    std::string out = "{length = " + std::to_string(bytes.size()) + ", bytes = 0x";
    size_t shown = bytes.size() < 24 ? bytes.size() : 24;
    char hex[3];
    for (size_t i = 0; i < shown; ++i) {
        std::snprintf(hex, sizeof hex, "%02x", bytes[i]);
        out += hex;
    }
    if (shown < bytes.size())
        out += "...";
    out += "}";
    return out;
}

std::string Data::description() const {
    return describeBytes(bytes_);
}

bool Data::isEqual(const Object& other) const {
    auto d = dynamic_cast<const Data*>(&other);
    return d && d->bytes_ == bytes_;
}

}  // namespace tamber
