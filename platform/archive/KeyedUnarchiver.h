#pragma once

#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Data.h"
#include "platform/objects/Object.h"
#include "support/Result.h"

namespace tamber {

// Reads keyed archives written by KeyedArchiver. Never trusts the bytes: truncated data, a
// top level of the wrong shape, UIDs out of range, reference cycles, nesting deeper than
// kMaxDepth, more than kMaxObjects decoded objects, inputs over kMaxInputSize, or a class that
// is not allowed all give an error (KeyedArchiveErrorDomain), never a crash, hang or
// unbounded allocation.
class KeyedUnarchiver {
public:
    static constexpr size_t kMaxInputSize = 64u << 20;
    static constexpr size_t kMaxDepth = 256;
    static constexpr size_t kMaxObjects = 1u << 20;

    // No class restriction: any registered class may appear anywhere in the graph.
    static Result<ObjectRef> unarchiveObjectWithData(const Bytes& data);
    // Every decoded object, the root and the objects it holds, must be of one of `classes`.
    static Result<ObjectRef> unarchivedObjectOfClasses(const std::set<std::string>& classes,
                                                       const Bytes& data);
    // The root (and what it holds) must be of class T.
    template <class T>
    static Result<std::shared_ptr<const T>> unarchivedObjectOfClass(const Bytes& data) {
        auto r = unarchivedObjectOfClasses({std::string(T::kClassName)}, data);
        if (!r.ok())
            return r.error();
        auto typed = objectCast<T>(r.value());
        if (!typed)
            return wrongClassError(T::kClassName, r.value());
        return typed;
    }

    // For the decoders of archivable classes (see ArchiveClassRegistry). Missing keys or values
    // of the wrong type give nothing; a decoder that needs a value calls failWithError.
    ObjectRef decodeObject(std::string_view key);
    std::optional<std::vector<ObjectRef>> decodeObjects(std::string_view key);
    std::optional<int64_t> decodeInt64(std::string_view key);
    std::optional<uint64_t> decodeUInt64(std::string_view key);
    std::optional<double> decodeDouble(std::string_view key);
    std::optional<bool> decodeBool(std::string_view key);
    // Like decodeObject and decodeObjects, but the objects (and what they hold) may also be of
    // `classes` when the unarchive is restricted: a class vouches for its own fields.
    ObjectRef decodeObjectOfClasses(std::string_view key, const std::vector<std::string>& classes);
    std::optional<std::vector<ObjectRef>> decodeObjectsOfClasses(
        std::string_view key, const std::vector<std::string>& classes);
    // Null or a T; an object of any other class fails the unarchive.
    template <class T>
    std::shared_ptr<const T> decodeObjectOfClass(std::string_view key) {
        ObjectRef object = decodeObjectOfClasses(key, {std::string(T::kClassName)});
        if (!object)
            return nullptr;
        auto typed = objectCast<T>(object);
        if (!typed)
            failWithError(wrongClassError(T::kClassName, object));
        return typed;
    }
    bool containsValue(std::string_view key) const;
    void failWithError(Error error);

    class Impl;
    explicit KeyedUnarchiver(Impl& impl) : impl_(impl) {}

private:
    static Error wrongClassError(std::string_view expected, const ObjectRef& actual);
    Impl& impl_;
};

}  // namespace tamber
