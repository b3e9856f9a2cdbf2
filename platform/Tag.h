#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "platform/objects/Data.h"
#include "platform/objects/Object.h"

namespace tamber {

// A user tag: a label and a colour index (0 = no colour).
class Tag : public Object {
public:
    static constexpr std::string_view kClassName = "Tag";
    Tag(std::string label, int64_t colour) : label_(std::move(label)), colour_(colour) {}
    static std::shared_ptr<const Tag> make(std::string label, int64_t colour = 0);

    const std::string& label() const { return label_; }
    int64_t colour() const { return colour_; }

    std::string_view className() const override { return kClassName; }
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    std::string label_;
    int64_t colour_;
};

// Tag data: a binary property list array of dictionaries {"label": string, "colour": integer}.
Bytes GetTagsDataForTags(const std::vector<std::shared_ptr<const Tag>>& tags);
// Nothing when the data is not such a list. Entries without a string label are skipped.
std::optional<std::vector<std::shared_ptr<const Tag>>> GetTagsFromTagsData(const Bytes& data);

}  // namespace tamber
