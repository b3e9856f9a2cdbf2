#include "platform/objects/Dictionary.h"

namespace tamber {

std::shared_ptr<const Dictionary> Dictionary::make(std::map<std::string, ObjectRef> entries) {
    return std::make_shared<const Dictionary>(std::move(entries));
}

ObjectRef Dictionary::objectForKey(const std::string& key) const {
    auto it = entries_.find(key);
    return it == entries_.end() ? nullptr : it->second;
}

std::string Dictionary::description() const {
    std::string out = "{";
    bool first = true;
    for (const auto& [k, v] : entries_) {
        if (!first)
            out += ", ";
        first = false;
        out += k + " = " + (v ? v->description() : "null");
    }
    return out + "}";
}

bool Dictionary::isEqual(const Object& other) const {
    auto d = dynamic_cast<const Dictionary*>(&other);
    if (!d || d->entries_.size() != entries_.size())
        return false;
    for (const auto& [k, v] : entries_) {
        auto it = d->entries_.find(k);
        if (it == d->entries_.end() || !objectsEqual(v, it->second))
            return false;
    }
    return true;
}

}  // namespace tamber
