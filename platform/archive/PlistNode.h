#pragma once

#include <plist/plist.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// Owns a libplist node and everything under it. The static readers work on borrowed nodes
// (children of an owned tree) and give nothing when the node is null or of another type.
class PlistNode {
public:
    PlistNode() = default;
    explicit PlistNode(plist_t node) : node_(node) {}
    ~PlistNode();
    PlistNode(PlistNode&& other) noexcept : node_(other.release()) {}
    PlistNode& operator=(PlistNode&& other) noexcept;
    PlistNode(const PlistNode&) = delete;
    PlistNode& operator=(const PlistNode&) = delete;

    static PlistNode dictionary() { return PlistNode(plist_new_dict()); }
    static PlistNode array() { return PlistNode(plist_new_array()); }
    // Callers make sure that `value` is UTF-8 without NUL characters (see isPlistString).
    static PlistNode string(const std::string& value);
    static PlistNode unsignedInteger(uint64_t value) { return PlistNode(plist_new_uint(value)); }
    static PlistNode real(double value) { return PlistNode(plist_new_real(value)); }
    static PlistNode boolean(bool value) { return PlistNode(plist_new_bool(value ? 1 : 0)); }
    static PlistNode data(const Bytes& bytes);
    static PlistNode uid(uint64_t value) { return PlistNode(plist_new_uid(value)); }

    // Parses a binary property list of at most `maxSize` bytes, after BinaryPlistValidator
    // has accepted it. Errors are InvalidData or InputTooLarge (kArchiveErrorDomain).
    static Result<PlistNode> fromBinary(const uint8_t* bytes, size_t size, size_t maxSize);
    static Result<PlistNode> fromBinary(const Bytes& bytes, size_t maxSize) {
        return fromBinary(bytes.data(), bytes.size(), maxSize);
    }
    Result<Bytes> toBinary() const;

    plist_t get() const { return node_; }
    plist_t release();
    explicit operator bool() const { return node_ != nullptr; }

    // Appends to an array, or sets a dictionary entry; `value` is moved into this tree.
    static void append(plist_t array, PlistNode value);
    static void set(plist_t dictionary, const std::string& key, PlistNode value);

    static bool isType(plist_t node, plist_type type) {
        return node && plist_get_node_type(node) == type;
    }
    // The entry for `key`, or null when `dictionary` is not a dictionary or has no such key.
    static plist_t member(plist_t dictionary, std::string_view key);
    // Zero when `array` is not an array.
    static uint32_t arraySize(plist_t array);
    // All elements in one pass: libplist 2.2 finds an element by index by walking a list, so a
    // loop over element() is quadratic.
    static std::vector<plist_t> elements(plist_t array);

    static std::optional<std::string> stringValue(plist_t node);
    static std::optional<uint64_t> unsignedValue(plist_t node);
    static std::optional<double> realValue(plist_t node);
    static std::optional<bool> boolValue(plist_t node);
    static std::optional<uint64_t> uidValue(plist_t node);
    static std::optional<Bytes> dataValue(plist_t node);

    // libplist strings are NUL-terminated, and it converts them to UTF-16 when writing; only
    // valid UTF-8 without NUL characters comes back unchanged.
    static bool isPlistString(std::string_view value);

private:
    plist_t node_ = nullptr;
};

}  // namespace tamber
