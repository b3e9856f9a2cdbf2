#include "cli/JsonValues.h"

namespace tamber {

nlohmann::json dateJson(const std::shared_ptr<const Date>& date) {
    return date ? nlohmann::json(date->iso8601()) : nlohmann::json(nullptr);
}

nlohmann::json numberJson(const std::shared_ptr<const Number>& n) {
    if (!n)
        return nullptr;
    switch (n->kind()) {
        case Number::Kind::Unsigned:
            return n->uint64Value();
        case Number::Kind::Signed:
            return n->int64Value();
        case Number::Kind::Floating:
            return n->doubleValue();
        case Number::Kind::Boolean:
            return n->boolValue();
    }
    return nullptr;
}

}  // namespace tamber
