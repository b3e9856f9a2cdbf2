#include "platform/archive/BuiltinArchiveClasses.h"

#include <cmath>

#include "platform/Tag.h"
#include "platform/archive/ArchiveError.h"
#include "platform/objects/Array.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"

namespace tamber {

namespace {

// Number "kind" values. libplist integers are unsigned 64-bit, so a signed value is stored as
// its two's-complement bits and the kind says how to read them back.
constexpr uint64_t kUnsignedKind = 0;
constexpr uint64_t kSignedKind = 1;
constexpr uint64_t kFloatingKind = 2;
constexpr uint64_t kBooleanKind = 3;

// The registry finds encoders by class name, which any Object subclass may claim.
template <class T>
const T* expect(const Object& object, KeyedArchiver& archiver) {
    auto typed = dynamic_cast<const T*>(&object);
    if (!typed)
        archiver.failWithError(archiveError(
            ArchiveErrorCode::UnregisteredClass,
            "an object calling itself " + std::string(object.className()) + " is not one"));
    return typed;
}

ObjectRef invalid(KeyedUnarchiver& unarchiver, std::string reason) {
    unarchiver.failWithError(archiveError(ArchiveErrorCode::InvalidValue, std::move(reason)));
    return nullptr;
}

ArchiveClass dateClass() {
    return {std::string(Date::kClassName),
            {},
            [](const Object& object, KeyedArchiver& archiver) {
                if (auto date = expect<Date>(object, archiver))
                    archiver.encodeDouble(date->timeIntervalSince1970(), "time");
            },
            [](KeyedUnarchiver& unarchiver) -> ObjectRef {
                auto time = unarchiver.decodeDouble("time");
                if (!time)
                    return invalid(unarchiver, "date has no time");
                // Not a point in time, and it equals nothing, itself included.
                if (!std::isfinite(*time))
                    return invalid(unarchiver, "date is not a finite time");
                return Date::make(*time);
            }};
}

void encodeNumber(const Number& number, KeyedArchiver& archiver) {
    switch (number.kind()) {
        case Number::Kind::Unsigned:
            archiver.encodeUInt64(kUnsignedKind, "kind");
            archiver.encodeUInt64(number.uint64Value(), "value");
            break;
        case Number::Kind::Signed:
            archiver.encodeUInt64(kSignedKind, "kind");
            archiver.encodeInt64(number.int64Value(), "value");
            break;
        case Number::Kind::Floating:
            archiver.encodeUInt64(kFloatingKind, "kind");
            archiver.encodeDouble(number.doubleValue(), "value");
            break;
        case Number::Kind::Boolean:
            archiver.encodeUInt64(kBooleanKind, "kind");
            archiver.encodeBool(number.boolValue(), "value");
            break;
    }
}

ObjectRef decodeNumber(KeyedUnarchiver& unarchiver) {
    auto kind = unarchiver.decodeUInt64("kind");
    if (!kind)
        return invalid(unarchiver, "number has no kind");
    switch (*kind) {
        case kUnsignedKind:
            if (auto v = unarchiver.decodeUInt64("value"))
                return Number::fromUInt64(*v);
            break;
        case kSignedKind:
            if (auto v = unarchiver.decodeInt64("value"))
                return Number::fromInt64(*v);
            break;
        case kFloatingKind:
            if (auto v = unarchiver.decodeDouble("value"))
                return Number::fromDouble(*v);
            break;
        case kBooleanKind:
            if (auto v = unarchiver.decodeBool("value"))
                return Number::fromBool(*v);
            break;
        default:
            return invalid(unarchiver, "number has unknown kind " + std::to_string(*kind));
    }
    return invalid(unarchiver, "number has no value of its kind");
}

ArchiveClass numberClass() {
    return {std::string(Number::kClassName),
            {},
            [](const Object& object, KeyedArchiver& archiver) {
                if (auto number = expect<Number>(object, archiver))
                    encodeNumber(*number, archiver);
            },
            decodeNumber};
}

ArchiveClass arrayClass() {
    return {std::string(Array::kClassName),
            {},
            [](const Object& object, KeyedArchiver& archiver) {
                if (auto array = expect<Array>(object, archiver))
                    archiver.encodeObjects(array->objects(), "objects");
            },
            [](KeyedUnarchiver& unarchiver) -> ObjectRef {
                auto objects = unarchiver.decodeObjects("objects");
                if (!objects)
                    return invalid(unarchiver, "array has no objects");
                return Array::make(std::move(*objects));
            }};
}

void encodeDictionary(const Dictionary& dictionary, KeyedArchiver& archiver) {
    std::vector<ObjectRef> keys;
    std::vector<ObjectRef> values;
    keys.reserve(dictionary.entries().size());
    values.reserve(dictionary.entries().size());
    for (const auto& [key, value] : dictionary.entries()) {
        keys.push_back(String::make(key));
        values.push_back(value);
    }
    archiver.encodeObjects(keys, "keys");
    archiver.encodeObjects(values, "values");
}

ObjectRef decodeDictionary(KeyedUnarchiver& unarchiver) {
    // Keys are strings by construction; they need not be in the caller's allowed classes.
    auto keys = unarchiver.decodeObjectsOfClasses("keys", {std::string(String::kClassName)});
    auto values = unarchiver.decodeObjects("values");
    if (!keys || !values)
        return invalid(unarchiver, "dictionary has no keys or values");
    if (keys->size() != values->size())
        return invalid(unarchiver, "dictionary has " + std::to_string(keys->size()) + " keys but " +
                                       std::to_string(values->size()) + " values");
    std::map<std::string, ObjectRef> entries;
    for (size_t i = 0; i < keys->size(); ++i) {
        auto key = objectCast<String>((*keys)[i]);
        if (!key)
            return invalid(unarchiver, "dictionary key is not a string");
        if (!entries.emplace(key->value(), (*values)[i]).second)
            return invalid(unarchiver, "dictionary key \"" + key->value() + "\" appears twice");
    }
    return Dictionary::make(std::move(entries));
}

ArchiveClass dictionaryClass() {
    return {std::string(Dictionary::kClassName),
            {},
            [](const Object& object, KeyedArchiver& archiver) {
                if (auto dictionary = expect<Dictionary>(object, archiver))
                    encodeDictionary(*dictionary, archiver);
            },
            decodeDictionary};
}

ArchiveClass tagClass() {
    return {std::string(Tag::kClassName),
            {},
            [](const Object& object, KeyedArchiver& archiver) {
                auto tag = expect<Tag>(object, archiver);
                if (!tag)
                    return;
                archiver.encodeObject(String::make(tag->label()), "label");
                archiver.encodeInt64(tag->colour(), "colour");
            },
            [](KeyedUnarchiver& unarchiver) -> ObjectRef {
                auto label = unarchiver.decodeObjectOfClass<String>("label");
                if (!label)
                    return invalid(unarchiver, "tag has no label");
                int64_t colour = 0;
                if (unarchiver.containsValue("colour")) {
                    auto value = unarchiver.decodeInt64("colour");
                    if (!value)
                        return invalid(unarchiver, "tag colour is not an integer");
                    colour = *value;
                }
                return Tag::make(label->value(), colour);
            }};
}

}  // namespace

std::vector<ArchiveClass> builtinArchiveClasses() {
    return {dateClass(), numberClass(), arrayClass(), dictionaryClass(), tagClass()};
}

}  // namespace tamber
