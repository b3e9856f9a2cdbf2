#pragma once

#include "platform/objects/Object.h"

namespace tamber {

class String : public Object {
public:
    static constexpr std::string_view kClassName = "String";
    explicit String(std::string value) : value_(std::move(value)) {}
    static std::shared_ptr<const String> make(std::string value);

    const std::string& value() const { return value_; }

    std::string_view className() const override { return kClassName; }
    std::string description() const override { return value_; }
    bool isEqual(const Object& other) const override;

private:
    std::string value_;
};

}  // namespace tamber
