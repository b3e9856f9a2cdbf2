#pragma once

#include <map>
#include <string>

#include "platform/objects/Object.h"

namespace tamber {

// A string-keyed dictionary.
class Dictionary : public Object {
public:
    static constexpr std::string_view kClassName = "Dictionary";
    explicit Dictionary(std::map<std::string, ObjectRef> entries) : entries_(std::move(entries)) {}
    static std::shared_ptr<const Dictionary> make(std::map<std::string, ObjectRef> entries);

    const std::map<std::string, ObjectRef>& entries() const { return entries_; }
    ObjectRef objectForKey(const std::string& key) const;

    std::string_view className() const override { return kClassName; }
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    std::map<std::string, ObjectRef> entries_;
};

}  // namespace tamber
