#pragma once

#include <vector>

#include "platform/objects/Object.h"

namespace tamber {

class Array : public Object {
public:
    static constexpr std::string_view kClassName = "Array";
    explicit Array(std::vector<ObjectRef> objects) : objects_(std::move(objects)) {}
    static std::shared_ptr<const Array> make(std::vector<ObjectRef> objects);

    const std::vector<ObjectRef>& objects() const { return objects_; }
    size_t count() const { return objects_.size(); }

    std::string_view className() const override { return kClassName; }
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    std::vector<ObjectRef> objects_;
};

}  // namespace tamber
