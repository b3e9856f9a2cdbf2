#include "items/XdgTagList.h"

#include <set>

#include "platform/archive/PlistNode.h"

namespace tamber {

namespace {

bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f';
}

bool hasControl(std::string_view text) {
    for (char c : text)
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f)
            return true;
    return false;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isSpace(text.front())) text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back())) text.remove_suffix(1);
    return text;
}

bool acceptable(std::string_view label) {
    return !label.empty() && label.size() <= XdgTagList::kMaxLabelBytes && !hasControl(label) &&
           PlistNode::isPlistString(label);
}

}  // namespace

const std::string& XdgTagList::attributeName() {
    static const std::string name = "xdg.tags";
    return name;
}

const std::string& XdgTagList::syncedAttributeName() {
    static const std::string name = "com.velk.xdg-tags.synced#PS";
    return name;
}

std::vector<std::string> XdgTagList::parse(std::string_view value) {
    std::vector<std::string> labels;
    std::set<std::string_view> seen;
    while (labels.size() < kMaxTags) {
        size_t comma = value.find(',');
        std::string_view entry = trimmed(value.substr(0, comma));
        if (acceptable(entry) && seen.insert(entry).second)
            labels.emplace_back(entry);
        if (comma == std::string_view::npos)
            break;
        value.remove_prefix(comma + 1);
    }
    return labels;
}

bool XdgTagList::representable(std::string_view label) {
    return acceptable(label) && label.find(',') == std::string_view::npos &&
           trimmed(label).size() == label.size();
}

std::optional<Bytes> XdgTagList::format(const std::vector<std::string>& labels) {
    std::string list;
    std::set<std::string> seen;
    size_t count = 0;
    for (const auto& label : labels) {
        if (count == kMaxTags || !representable(label) || !seen.insert(label).second)
            continue;
        if (count++ > 0)
            list += ',';
        list += label;
    }
    if (count == 0)
        return std::nullopt;
    return Bytes(list.begin(), list.end());
}

Bytes XdgTagList::fingerprint(const Bytes& value) {
    // FNV-1a: the note only has to tell one list from another, not resist anyone.
    uint64_t hash = 0xcbf29ce484222325ull;
    for (uint8_t byte : value) {
        hash ^= byte;
        hash *= 0x100000001b3ull;
    }
    static const char kDigits[] = "0123456789abcdef";
    Bytes text;
    for (int shift = 60; shift >= 0; shift -= 4) text.push_back(kDigits[(hash >> shift) & 0xf]);
    // The length too, so that lists of different sizes never share a note.
    text.push_back(':');
    for (char c : std::to_string(value.size())) text.push_back(static_cast<uint8_t>(c));
    return text;
}

XdgTagList::Tags XdgTagList::merged(const Tags& ours, const std::vector<std::string>& theirs) {
    Tags result;
    std::set<std::string> taken;
    for (const auto& label : theirs) {
        if (!taken.insert(label).second)
            continue;
        int64_t colour = 0;
        for (const auto& tag : ours)
            if (tag && tag->label() == label) {
                colour = tag->colour();
                break;
            }
        result.push_back(Tag::make(label, colour));
    }
    for (const auto& tag : ours)
        if (tag && !representable(tag->label()) && taken.insert(tag->label()).second)
            result.push_back(tag);
    return result;
}

}  // namespace tamber
