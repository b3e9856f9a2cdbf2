#include "platform/archive/KeyedArchiver.h"

#include <map>
#include <unordered_map>

#include "platform/archive/ArchiveClassRegistry.h"
#include "platform/archive/ArchiveError.h"
#include "platform/archive/PlistNode.h"
#include "platform/objects/String.h"

namespace tamber {

class KeyedArchiver::Impl {
public:
    Impl() : objects_(PlistNode::array()) {
        PlistNode::append(objects_.get(), PlistNode::string("$null"));
    }

    // The UID of `object`, archiving it first if it has not been.
    uint64_t encodeReference(const ObjectRef& object);
    void setValue(std::string_view key, PlistNode value);
    void fail(Error error) {
        if (error_.ok())
            error_ = std::move(error);
    }
    Result<Bytes> finish(uint64_t rootUid);

private:
    uint64_t append(PlistNode node) {
        PlistNode::append(objects_.get(), std::move(node));
        return count_++;
    }
    const ArchiveClass* lookUp(std::string_view name);
    uint64_t classUid(const ArchiveClass& archiveClass);
    uint64_t appendObject(const ObjectRef& object, PlistNode node);

    PlistNode objects_;
    uint64_t count_ = 1;
    // Keyed by identity. The reference keeps the object alive, so that an encoder's temporary
    // cannot be freed and its address reused by a different object.
    std::unordered_map<const Object*, std::pair<ObjectRef, uint64_t>> uids_;
    std::map<std::string, ArchiveClass, std::less<>> classes_;
    std::map<std::string, uint64_t, std::less<>> classUids_;
    plist_t current_ = nullptr;  // the dictionary the running encoder writes into
    size_t depth_ = 0;
    Status error_;
};

const ArchiveClass* KeyedArchiver::Impl::lookUp(std::string_view name) {
    auto it = classes_.find(name);
    if (it != classes_.end())
        return &it->second;
    auto found = ArchiveClassRegistry::shared().find(name);
    if (!found)
        return nullptr;
    return &classes_.emplace(std::string(name), std::move(*found)).first->second;
}

uint64_t KeyedArchiver::Impl::classUid(const ArchiveClass& archiveClass) {
    auto it = classUids_.find(archiveClass.name);
    if (it != classUids_.end())
        return it->second;
    PlistNode description = PlistNode::dictionary();
    PlistNode::set(description.get(), "$classname", PlistNode::string(archiveClass.name));
    PlistNode names = PlistNode::array();
    for (const auto& name : archiveClass.hierarchy) {
        if (!PlistNode::isPlistString(name)) {
            fail(
                archiveError(ArchiveErrorCode::UnencodableValue,
                             "class " + archiveClass.name + " has an unencodable superclass name"));
            return 0;
        }
        PlistNode::append(names.get(), PlistNode::string(name));
    }
    PlistNode::set(description.get(), "$classes", std::move(names));
    uint64_t uid = append(std::move(description));
    classUids_.emplace(archiveClass.name, uid);
    return uid;
}

uint64_t KeyedArchiver::Impl::appendObject(const ObjectRef& object, PlistNode node) {
    uint64_t uid = append(std::move(node));
    uids_.emplace(object.get(), std::make_pair(object, uid));
    return uid;
}

uint64_t KeyedArchiver::Impl::encodeReference(const ObjectRef& object) {
    if (!error_.ok() || !object)
        return 0;
    if (auto it = uids_.find(object.get()); it != uids_.end())
        return it->second.second;
    // What the unarchiver would refuse is refused here, so that every archive reads back.
    if (count_ > KeyedUnarchiver::kMaxObjects) {
        fail(
            archiveError(ArchiveErrorCode::TooManyObjects,
                         "more than " + std::to_string(KeyedUnarchiver::kMaxObjects) + " objects"));
        return 0;
    }
    if (depth_ >= KeyedUnarchiver::kMaxDepth) {
        fail(archiveError(ArchiveErrorCode::TooDeep,
                          "objects nested deeper than " +
                              std::to_string(KeyedUnarchiver::kMaxDepth) + " levels"));
        return 0;
    }
    if (auto string = objectCast<String>(object)) {
        if (!PlistNode::isPlistString(string->value())) {
            fail(archiveError(ArchiveErrorCode::UnencodableValue,
                              "string is not UTF-8 or contains a NUL character"));
            return 0;
        }
        return appendObject(object, PlistNode::string(string->value()));
    }
    if (auto data = objectCast<Data>(object))
        return appendObject(object, PlistNode::data(data->bytes()));

    const ArchiveClass* archiveClass = lookUp(object->className());
    if (!archiveClass) {
        fail(archiveError(ArchiveErrorCode::UnregisteredClass,
                          "class " + std::string(object->className()) + " is not registered"));
        return 0;
    }
    uint64_t classReference = classUid(*archiveClass);
    if (!error_.ok())
        return 0;

    // Appended before its fields are encoded: the node stays where it is, and the UID is known
    // to anything below it that refers back.
    PlistNode dictionary = PlistNode::dictionary();
    plist_t fields = dictionary.get();
    PlistNode::set(fields, "$class", PlistNode::uid(classReference));
    uint64_t uid = appendObject(object, std::move(dictionary));

    plist_t saved = current_;
    current_ = fields;
    ++depth_;
    KeyedArchiver archiver(*this);
    archiveClass->encode(*object, archiver);
    --depth_;
    current_ = saved;
    return uid;
}

void KeyedArchiver::Impl::setValue(std::string_view key, PlistNode value) {
    if (!error_.ok())
        return;
    if (!current_) {
        fail(archiveError(ArchiveErrorCode::UnencodableValue, "value encoded outside an object"));
        return;
    }
    if (key.empty() || key.front() == '$' || !PlistNode::isPlistString(key)) {
        fail(archiveError(ArchiveErrorCode::UnencodableValue,
                          "key \"" + std::string(key) + "\" cannot be used"));
        return;
    }
    PlistNode::set(current_, std::string(key), std::move(value));
}

Result<Bytes> KeyedArchiver::Impl::finish(uint64_t rootUid) {
    if (!error_.ok())
        return error_.error();
    PlistNode top = PlistNode::dictionary();
    PlistNode::set(top.get(), "$archiver", PlistNode::string("KeyedArchiver"));
    PlistNode::set(top.get(), "$version", PlistNode::unsignedInteger(100000));
    PlistNode root = PlistNode::dictionary();
    PlistNode::set(root.get(), "root", PlistNode::uid(rootUid));
    PlistNode::set(top.get(), "$top", std::move(root));
    PlistNode::set(top.get(), "$objects", std::move(objects_));
    auto bytes = top.toBinary();
    if (bytes.ok() && bytes->size() > KeyedUnarchiver::kMaxInputSize)
        return archiveError(ArchiveErrorCode::InputTooLarge,
                            "archive would be " + std::to_string(bytes->size()) + " bytes");
    return bytes;
}

Result<Bytes> KeyedArchiver::archivedDataWithRootObject(const ObjectRef& root) {
    Impl impl;
    uint64_t rootUid = impl.encodeReference(root);
    return impl.finish(rootUid);
}

void KeyedArchiver::encodeObject(const ObjectRef& object, std::string_view key) {
    uint64_t uid = impl_.encodeReference(object);
    impl_.setValue(key, PlistNode::uid(uid));
}

void KeyedArchiver::encodeInt64(int64_t value, std::string_view key) {
    impl_.setValue(key, PlistNode::unsignedInteger(static_cast<uint64_t>(value)));
}

void KeyedArchiver::encodeUInt64(uint64_t value, std::string_view key) {
    impl_.setValue(key, PlistNode::unsignedInteger(value));
}

void KeyedArchiver::encodeDouble(double value, std::string_view key) {
    impl_.setValue(key, PlistNode::real(value));
}

void KeyedArchiver::encodeBool(bool value, std::string_view key) {
    impl_.setValue(key, PlistNode::boolean(value));
}

void KeyedArchiver::encodeObjects(const std::vector<ObjectRef>& objects, std::string_view key) {
    PlistNode array = PlistNode::array();
    for (const auto& object : objects)
        PlistNode::append(array.get(), PlistNode::uid(impl_.encodeReference(object)));
    impl_.setValue(key, std::move(array));
}

void KeyedArchiver::failWithError(Error error) {
    impl_.fail(std::move(error));
}

}  // namespace tamber
