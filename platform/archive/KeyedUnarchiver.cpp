#include "platform/archive/KeyedUnarchiver.h"

#include <map>
#include <unordered_map>

#include "platform/archive/ArchiveClassRegistry.h"
#include "platform/archive/ArchiveError.h"
#include "platform/archive/PlistNode.h"
#include "platform/objects/String.h"

namespace tamber {

namespace {

const std::vector<std::string>& scalarHierarchy(std::string_view name) {
    static const std::vector<std::string> string{std::string(String::kClassName), "Object"};
    static const std::vector<std::string> data{std::string(Data::kClassName), "Object"};
    return name == String::kClassName ? string : data;
}

std::string objectName(uint64_t uid) {
    return "object " + std::to_string(uid);
}

}  // namespace

class KeyedUnarchiver::Impl {
public:
    explicit Impl(std::optional<std::set<std::string>> allowed) : allowed_(std::move(allowed)) {}

    Result<ObjectRef> run(const Bytes& data);
    ObjectRef decodeUid(uint64_t uid);
    // The UIDs of an array of references; nothing when `value` is not one.
    std::optional<std::vector<uint64_t>> uidArray(plist_t value);
    plist_t member(std::string_view key) const { return PlistNode::member(current_, key); }
    void fail(Error error) {
        if (error_.ok())
            error_ = std::move(error);
    }
    bool failed() const { return !error_.ok(); }

    // While decoding a field its class asked for by class.
    void pushClasses(const std::vector<std::string>& classes) {
        extra_.insert(extra_.end(), classes.begin(), classes.end());
    }
    void popClasses(size_t count) { extra_.resize(extra_.size() - count); }

private:
    struct Decoded {
        ObjectRef object;
        const std::vector<std::string>* hierarchy = nullptr;
        bool inProgress = true;
    };

    Status checkTopLevel(plist_t top, uint64_t& rootUid);
    bool isAllowed(const std::vector<std::string>& hierarchy) const;
    bool checkAllowed(const std::vector<std::string>& hierarchy);
    const ArchiveClass* classOf(uint64_t uid, plist_t fields);
    ObjectRef decodeFields(uint64_t uid, plist_t fields, const ArchiveClass& archiveClass);

    std::optional<std::set<std::string>> allowed_;
    std::vector<std::string> extra_;
    PlistNode top_;
    std::vector<plist_t> objects_;  // "$objects", indexed by UID
    uint64_t count_ = 0;
    // Only what was decoded: the memo is what makes heavily shared graphs cheap, and the
    // in-progress mark is what finds cycles.
    std::unordered_map<uint64_t, Decoded> decoded_;
    std::map<std::string, ArchiveClass, std::less<>> classes_;
    std::unordered_map<uint64_t, const ArchiveClass*> classDescriptions_;
    plist_t current_ = nullptr;  // the fields of the object being decoded
    size_t depth_ = 0;
    Status error_;
};

Status KeyedUnarchiver::Impl::checkTopLevel(plist_t top, uint64_t& rootUid) {
    auto shape = [](std::string what) {
        return archiveError(ArchiveErrorCode::InvalidData, "not a keyed archive: " + what);
    };
    if (!PlistNode::isType(top, PLIST_DICT))
        return shape("top level is not a dictionary");
    auto archiver = PlistNode::stringValue(PlistNode::member(top, "$archiver"));
    if (!archiver)
        return shape("no $archiver");
    if (*archiver != "KeyedArchiver")
        return shape("unknown archiver \"" + *archiver + "\"");
    plist_t version = PlistNode::member(top, "$version");
    if (version && !PlistNode::unsignedValue(version))
        return shape("$version is not a number");
    plist_t topObjects = PlistNode::member(top, "$top");
    if (!PlistNode::isType(topObjects, PLIST_DICT))
        return shape("no $top dictionary");
    auto root = PlistNode::uidValue(PlistNode::member(topObjects, "root"));
    if (!root)
        return shape("no root UID");
    plist_t objects = PlistNode::member(top, "$objects");
    if (!PlistNode::isType(objects, PLIST_ARRAY))
        return shape("no $objects array");
    objects_ = PlistNode::elements(objects);
    count_ = objects_.size();
    if (count_ == 0 || PlistNode::stringValue(objects_[0]) != "$null")
        return shape("$objects does not start with $null");
    rootUid = *root;
    return Status::OK();
}

Result<ObjectRef> KeyedUnarchiver::Impl::run(const Bytes& data) {
    auto parsed = PlistNode::fromBinary(data, kMaxInputSize);
    if (!parsed.ok()) {
        const Error& error = parsed.error();
        if (error.code() != static_cast<int64_t>(ArchiveErrorCode::InvalidData))
            return error;
        auto reason = error.userInfo().find("description");
        return archiveError(ArchiveErrorCode::InvalidData,
                            "archive is truncated or not a property list (" +
                                (reason == error.userInfo().end() ? "" : reason->second) + ")");
    }
    top_ = std::move(parsed).value();
    uint64_t rootUid = 0;
    if (auto bad = checkTopLevel(top_.get(), rootUid); !bad.ok())
        return bad.error();
    ObjectRef root = decodeUid(rootUid);
    if (!error_.ok())
        return error_.error();
    return root;
}

bool KeyedUnarchiver::Impl::isAllowed(const std::vector<std::string>& hierarchy) const {
    if (!allowed_)
        return true;
    for (const auto& name : hierarchy) {
        if (allowed_->count(name))
            return true;
        for (const auto& extra : extra_)
            if (extra == name)
                return true;
    }
    return false;
}

bool KeyedUnarchiver::Impl::checkAllowed(const std::vector<std::string>& hierarchy) {
    if (isAllowed(hierarchy))
        return true;
    fail(archiveError(ArchiveErrorCode::ClassNotAllowed,
                      "class " + hierarchy.front() + " is not allowed"));
    return false;
}

const ArchiveClass* KeyedUnarchiver::Impl::classOf(uint64_t uid, plist_t fields) {
    auto classUid = PlistNode::uidValue(PlistNode::member(fields, "$class"));
    if (!classUid) {
        fail(archiveError(ArchiveErrorCode::MalformedClass, objectName(uid) + " has no class"));
        return nullptr;
    }
    if (auto it = classDescriptions_.find(*classUid); it != classDescriptions_.end())
        return it->second;
    if (*classUid == 0 || *classUid >= count_) {
        fail(archiveError(ArchiveErrorCode::UidOutOfRange,
                          "class UID " + std::to_string(*classUid) + " out of range (" +
                              std::to_string(count_) + " objects)"));
        return nullptr;
    }
    plist_t description = objects_[*classUid];
    auto name = PlistNode::stringValue(PlistNode::member(description, "$classname"));
    plist_t names = PlistNode::member(description, "$classes");
    bool wellFormed =
        name && PlistNode::isType(names, PLIST_ARRAY) && PlistNode::isPlistString(*name);
    for (plist_t superclass : PlistNode::elements(names))
        wellFormed = wellFormed && PlistNode::stringValue(superclass).has_value();
    if (!wellFormed) {
        fail(archiveError(ArchiveErrorCode::MalformedClass,
                          "class description " + std::to_string(*classUid) + " is malformed"));
        return nullptr;
    }
    auto it = classes_.find(*name);
    if (it == classes_.end()) {
        auto found = ArchiveClassRegistry::shared().find(*name);
        if (!found) {
            fail(archiveError(ArchiveErrorCode::UnknownClass,
                              "class " + *name + " is not registered"));
            return nullptr;
        }
        it = classes_.emplace(*name, std::move(*found)).first;
    }
    classDescriptions_.emplace(*classUid, &it->second);
    return &it->second;
}

ObjectRef KeyedUnarchiver::Impl::decodeFields(uint64_t uid, plist_t fields,
                                              const ArchiveClass& archiveClass) {
    decoded_[uid] = Decoded{nullptr, &archiveClass.hierarchy, true};
    plist_t saved = current_;
    current_ = fields;
    ++depth_;
    KeyedUnarchiver unarchiver(*this);
    ObjectRef object = archiveClass.decode(unarchiver);
    --depth_;
    current_ = saved;
    if (!error_.ok())
        return nullptr;
    if (!object)
        fail(archiveError(ArchiveErrorCode::InvalidValue,
                          objectName(uid) + " of class " + archiveClass.name + " is malformed"));
    return object;
}

ObjectRef KeyedUnarchiver::Impl::decodeUid(uint64_t uid) {
    if (!error_.ok() || uid == 0)
        return nullptr;
    if (uid >= count_) {
        fail(archiveError(ArchiveErrorCode::UidOutOfRange,
                          "UID " + std::to_string(uid) + " out of range (" +
                              std::to_string(count_) + " objects)"));
        return nullptr;
    }
    if (auto it = decoded_.find(uid); it != decoded_.end()) {
        if (it->second.inProgress) {
            fail(archiveError(ArchiveErrorCode::ReferenceCycle,
                              "reference cycle at " + objectName(uid)));
            return nullptr;
        }
        // Decoded before, possibly where more classes were allowed.
        if (!checkAllowed(*it->second.hierarchy))
            return nullptr;
        return it->second.object;
    }
    if (depth_ >= kMaxDepth) {
        fail(archiveError(ArchiveErrorCode::TooDeep,
                          "objects nested deeper than " + std::to_string(kMaxDepth) + " levels"));
        return nullptr;
    }
    if (decoded_.size() >= kMaxObjects) {
        fail(archiveError(ArchiveErrorCode::TooManyObjects,
                          "more than " + std::to_string(kMaxObjects) + " objects"));
        return nullptr;
    }

    plist_t node = objects_[uid];
    ObjectRef object;
    const std::vector<std::string>* hierarchy = nullptr;
    if (auto string = PlistNode::stringValue(node)) {
        hierarchy = &scalarHierarchy(String::kClassName);
        if (!checkAllowed(*hierarchy))
            return nullptr;
        if (!PlistNode::isPlistString(*string)) {
            fail(archiveError(ArchiveErrorCode::InvalidValue, objectName(uid) + " is not UTF-8"));
            return nullptr;
        }
        object = String::make(std::move(*string));
    } else if (auto bytes = PlistNode::dataValue(node)) {
        hierarchy = &scalarHierarchy(Data::kClassName);
        if (!checkAllowed(*hierarchy))
            return nullptr;
        object = Data::make(std::move(*bytes));
    } else if (PlistNode::isType(node, PLIST_DICT)) {
        const ArchiveClass* archiveClass = classOf(uid, node);
        if (!archiveClass || !checkAllowed(archiveClass->hierarchy))
            return nullptr;
        hierarchy = &archiveClass->hierarchy;
        object = decodeFields(uid, node, *archiveClass);
        if (!object)
            return nullptr;
    } else {
        fail(archiveError(ArchiveErrorCode::InvalidData, objectName(uid) + " is not an object"));
        return nullptr;
    }
    decoded_[uid] = Decoded{object, hierarchy, false};
    return object;
}

std::optional<std::vector<uint64_t>> KeyedUnarchiver::Impl::uidArray(plist_t value) {
    if (!PlistNode::isType(value, PLIST_ARRAY))
        return std::nullopt;
    std::vector<uint64_t> uids;
    for (plist_t element : PlistNode::elements(value)) {
        auto uid = PlistNode::uidValue(element);
        if (!uid)
            return std::nullopt;
        uids.push_back(*uid);
    }
    return uids;
}

Result<ObjectRef> KeyedUnarchiver::unarchiveObjectWithData(const Bytes& data) {
    Impl impl(std::nullopt);
    return impl.run(data);
}

Result<ObjectRef> KeyedUnarchiver::unarchivedObjectOfClasses(const std::set<std::string>& classes,
                                                             const Bytes& data) {
    Impl impl(classes);
    return impl.run(data);
}

Error KeyedUnarchiver::wrongClassError(std::string_view expected, const ObjectRef& actual) {
    std::string found =
        actual ? "an object of class " + std::string(actual->className()) : "nothing";
    return archiveError(
        ArchiveErrorCode::WrongClass,
        "expected an object of class " + std::string(expected) + ", found " + found);
}

ObjectRef KeyedUnarchiver::decodeObject(std::string_view key) {
    auto uid = PlistNode::uidValue(impl_.member(key));
    if (!uid)
        return nullptr;
    return impl_.decodeUid(*uid);
}

std::optional<std::vector<ObjectRef>> KeyedUnarchiver::decodeObjects(std::string_view key) {
    auto uids = impl_.uidArray(impl_.member(key));
    if (!uids)
        return std::nullopt;
    std::vector<ObjectRef> objects;
    objects.reserve(uids->size());
    for (uint64_t uid : *uids) {
        objects.push_back(impl_.decodeUid(uid));
        if (impl_.failed())
            return std::nullopt;
    }
    return objects;
}

ObjectRef KeyedUnarchiver::decodeObjectOfClasses(std::string_view key,
                                                 const std::vector<std::string>& classes) {
    impl_.pushClasses(classes);
    ObjectRef object = decodeObject(key);
    impl_.popClasses(classes.size());
    return object;
}

std::optional<std::vector<ObjectRef>> KeyedUnarchiver::decodeObjectsOfClasses(
    std::string_view key, const std::vector<std::string>& classes) {
    impl_.pushClasses(classes);
    auto objects = decodeObjects(key);
    impl_.popClasses(classes.size());
    return objects;
}

std::optional<int64_t> KeyedUnarchiver::decodeInt64(std::string_view key) {
    auto value = PlistNode::unsignedValue(impl_.member(key));
    if (!value)
        return std::nullopt;
    return static_cast<int64_t>(*value);
}

std::optional<uint64_t> KeyedUnarchiver::decodeUInt64(std::string_view key) {
    return PlistNode::unsignedValue(impl_.member(key));
}

std::optional<double> KeyedUnarchiver::decodeDouble(std::string_view key) {
    return PlistNode::realValue(impl_.member(key));
}

std::optional<bool> KeyedUnarchiver::decodeBool(std::string_view key) {
    return PlistNode::boolValue(impl_.member(key));
}

bool KeyedUnarchiver::containsValue(std::string_view key) const {
    return impl_.member(key) != nullptr;
}

void KeyedUnarchiver::failWithError(Error error) {
    impl_.fail(std::move(error));
}

}  // namespace tamber
