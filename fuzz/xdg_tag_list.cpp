// Feeds arbitrary bytes to the reader of the desktop's tag list, as any program may write it.
// Whatever the bytes, the labels read must be ones Tamber can store and write back unchanged:
// within the limits, without commas or surrounding spaces, each once; and writing them and
// reading the list again must give the same labels.
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string>
#include <string_view>

#include "items/XdgTagList.h"

using namespace tamber;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view value(reinterpret_cast<const char*>(data), size);
    auto labels = XdgTagList::parse(value);
    if (labels.size() > XdgTagList::kMaxTags)
        std::abort();
    std::set<std::string> seen;
    for (const auto& label : labels) {
        if (!XdgTagList::representable(label) || label.size() > XdgTagList::kMaxLabelBytes ||
            !seen.insert(label).second)
            std::abort();
    }
    auto list = XdgTagList::format(labels);
    if (labels.empty() != !list.has_value())
        std::abort();
    if (list) {
        std::string_view written(reinterpret_cast<const char*>(list->data()), list->size());
        if (XdgTagList::parse(written) != labels)
            std::abort();
    }
    // Folding the list into tags that already hold every label keeps them all, in its order.
    XdgTagList::Tags ours;
    for (const auto& label : labels) ours.push_back(Tag::make(label, 1));
    auto merged = XdgTagList::merged(ours, labels);
    if (merged.size() != labels.size())
        std::abort();
    for (size_t i = 0; i < merged.size(); ++i)
        if (merged[i]->label() != labels[i] || merged[i]->colour() != 1)
            std::abort();
    return 0;
}
