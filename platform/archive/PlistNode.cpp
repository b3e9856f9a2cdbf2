#include "platform/archive/PlistNode.h"

#include <cstdlib>

#include "platform/archive/ArchiveError.h"
#include "platform/archive/BinaryPlistValidator.h"

namespace tamber {

PlistNode::~PlistNode() {
    if (node_)
        plist_free(node_);
}

PlistNode& PlistNode::operator=(PlistNode&& other) noexcept {
    if (this != &other) {
        if (node_)
            plist_free(node_);
        node_ = other.release();
    }
    return *this;
}

plist_t PlistNode::release() {
    plist_t node = node_;
    node_ = nullptr;
    return node;
}

PlistNode PlistNode::string(const std::string& value) {
    return PlistNode(plist_new_string(value.c_str()));
}

PlistNode PlistNode::data(const Bytes& bytes) {
    return PlistNode(plist_new_data(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
}

Result<PlistNode> PlistNode::fromBinary(const uint8_t* bytes, size_t size, size_t maxSize) {
    if (size > maxSize)
        return archiveError(ArchiveErrorCode::InputTooLarge,
                            std::to_string(size) + " bytes is more than the " +
                                std::to_string(maxSize) + " allowed");
    if (auto invalid =
            BinaryPlistValidator::validate(bytes, size, BinaryPlistValidator::limitsForSize(size));
        !invalid.ok())
        return invalid.error();
    plist_t node = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(bytes), static_cast<uint32_t>(size), &node);
    if (!node)
        return archiveError(ArchiveErrorCode::InvalidData, "malformed binary property list");
    return PlistNode(node);
}

Result<Bytes> PlistNode::toBinary() const {
    // libplist 2.2 leaves the output alone unless it starts out null.
    char* out = nullptr;
    uint32_t length = 0;
    if (node_)
        plist_to_bin(node_, &out, &length);
    if (!out)
        return archiveError(ArchiveErrorCode::UnencodableValue,
                            "could not write the binary property list");
    Bytes bytes(reinterpret_cast<const uint8_t*>(out),
                reinterpret_cast<const uint8_t*>(out) + length);
    std::free(out);
    return bytes;
}

void PlistNode::append(plist_t array, PlistNode value) {
    plist_array_append_item(array, value.release());
}

void PlistNode::set(plist_t dictionary, const std::string& key, PlistNode value) {
    plist_dict_set_item(dictionary, key.c_str(), value.release());
}

plist_t PlistNode::member(plist_t dictionary, std::string_view key) {
    if (!isType(dictionary, PLIST_DICT))
        return nullptr;
    return plist_dict_get_item(dictionary, std::string(key).c_str());
}

uint32_t PlistNode::arraySize(plist_t array) {
    return isType(array, PLIST_ARRAY) ? plist_array_get_size(array) : 0;
}

std::vector<plist_t> PlistNode::elements(plist_t array) {
    std::vector<plist_t> items;
    if (!isType(array, PLIST_ARRAY))
        return items;
    // Sized from a tree already in memory, not from a count in the input.
    items.reserve(plist_array_get_size(array));
    plist_array_iter iter = nullptr;
    plist_array_new_iter(array, &iter);
    if (!iter)
        return items;
    for (plist_t item = nullptr;;) {
        plist_array_next_item(array, iter, &item);
        if (!item)
            break;
        items.push_back(item);
    }
    std::free(iter);
    return items;
}

std::optional<std::string> PlistNode::stringValue(plist_t node) {
    if (!isType(node, PLIST_STRING))
        return std::nullopt;
    uint64_t length = 0;
    const char* p = plist_get_string_ptr(node, &length);
    if (!p)
        return std::nullopt;
    return std::string(p, length);
}

std::optional<uint64_t> PlistNode::unsignedValue(plist_t node) {
    if (!isType(node, PLIST_UINT))
        return std::nullopt;
    uint64_t value = 0;
    plist_get_uint_val(node, &value);
    return value;
}

std::optional<double> PlistNode::realValue(plist_t node) {
    if (!isType(node, PLIST_REAL))
        return std::nullopt;
    double value = 0;
    plist_get_real_val(node, &value);
    return value;
}

std::optional<bool> PlistNode::boolValue(plist_t node) {
    if (!isType(node, PLIST_BOOLEAN))
        return std::nullopt;
    uint8_t value = 0;
    plist_get_bool_val(node, &value);
    return value != 0;
}

std::optional<uint64_t> PlistNode::uidValue(plist_t node) {
    if (!isType(node, PLIST_UID))
        return std::nullopt;
    uint64_t value = 0;
    plist_get_uid_val(node, &value);
    return value;
}

std::optional<Bytes> PlistNode::dataValue(plist_t node) {
    if (!isType(node, PLIST_DATA))
        return std::nullopt;
    uint64_t length = 0;
    const char* p = plist_get_data_ptr(node, &length);
    if (!p || length == 0)
        return Bytes{};
    auto begin = reinterpret_cast<const uint8_t*>(p);
    return Bytes(begin, begin + length);
}

bool PlistNode::isPlistString(std::string_view value) {
    size_t i = 0;
    while (i < value.size()) {
        auto c = static_cast<unsigned char>(value[i]);
        if (c == 0)
            return false;
        if (c < 0x80) {
            ++i;
            continue;
        }
        size_t extra;
        uint32_t code;
        if ((c & 0xE0) == 0xC0) {
            extra = 1;
            code = c & 0x1F;
        } else if ((c & 0xF0) == 0xE0) {
            extra = 2;
            code = c & 0x0F;
        } else if ((c & 0xF8) == 0xF0) {
            extra = 3;
            code = c & 0x07;
        } else {
            return false;
        }
        if (value.size() - i <= extra)
            return false;
        for (size_t k = 1; k <= extra; ++k) {
            auto cc = static_cast<unsigned char>(value[i + k]);
            if ((cc & 0xC0) != 0x80)
                return false;
            code = (code << 6) | (cc & 0x3F);
        }
        // Overlong forms, surrogates and values past U+10FFFF.
        static constexpr uint32_t kMinimum[] = {0, 0x80, 0x800, 0x10000};
        if (code < kMinimum[extra] || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF))
            return false;
        i += extra + 1;
    }
    return true;
}

}  // namespace tamber
