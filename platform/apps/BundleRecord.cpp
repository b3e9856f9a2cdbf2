#include "platform/apps/BundleRecord.h"

#include <mutex>

#include "platform/apps/AppRegistry.h"
#include "platform/archive/ArchiveClassRegistry.h"
#include "platform/archive/ArchiveError.h"
#include "platform/objects/String.h"

namespace tamber {

namespace {

constexpr std::string_view kBundleIdentifierKey = "bundleIdentifier";
constexpr std::string_view kDataContainerPathKey = "dataContainerPath";
constexpr std::string_view kDisplayNameKey = "displayName";
constexpr std::string_view kIconNameKey = "iconName";

void encodeString(KeyedArchiver& archiver, const std::optional<std::string>& value,
                  std::string_view key) {
    // An absent field is left out rather than archived as null: the decoder treats a present
    // key that holds no string as a damaged archive.
    if (value)
        archiver.encodeObject(String::make(*value), key);
}

void encodeRecord(const Object& object, KeyedArchiver& archiver) {
    // Any Object may claim the class name; only records know their fields.
    auto record = dynamic_cast<const BundleRecord*>(&object);
    if (!record) {
        archiver.failWithError(archiveError(
            ArchiveErrorCode::UnregisteredClass,
            "an object calling itself " + std::string(object.className()) + " is not one"));
        return;
    }
    encodeString(archiver, record->bundleIdentifier(), kBundleIdentifierKey);
    if (record->dataContainerURL())
        encodeString(archiver, record->dataContainerURL()->path(), kDataContainerPathKey);
    encodeString(archiver, record->localizedName(), kDisplayNameKey);
    encodeString(archiver, record->iconName(), kIconNameKey);
}

// Every field is optional, but one that is there must be a string.
bool decodeString(KeyedUnarchiver& unarchiver, std::string_view key,
                  std::optional<std::string>& out) {
    if (!unarchiver.containsValue(key))
        return true;
    auto string = unarchiver.decodeObjectOfClass<String>(key);
    if (!string) {
        unarchiver.failWithError(
            archiveError(ArchiveErrorCode::InvalidValue,
                         "bundle record " + std::string(key) + " is not a string"));
        return false;
    }
    out = string->value();
    return true;
}

ObjectRef decodeRecord(KeyedUnarchiver& unarchiver) {
    BundleRecord::Fields fields;
    std::optional<std::string> containerPath;
    if (!decodeString(unarchiver, kBundleIdentifierKey, fields.bundleIdentifier) ||
        !decodeString(unarchiver, kDataContainerPathKey, containerPath) ||
        !decodeString(unarchiver, kDisplayNameKey, fields.localizedName) ||
        !decodeString(unarchiver, kIconNameKey, fields.iconName))
        return nullptr;
    if (containerPath) {
        // A relative path would silently resolve against whatever directory the process is in.
        if (containerPath->empty() || containerPath->front() != '/') {
            unarchiver.failWithError(archiveError(
                ArchiveErrorCode::InvalidValue,
                "bundle record data container \"" + *containerPath + "\" is not absolute"));
            return nullptr;
        }
        fields.dataContainerURL = Url::fileURLWithPath(*containerPath);
    }
    return BundleRecord::make(std::move(fields));
}

}  // namespace

BundleRecord::BundleRecord(Fields fields) : fields_(std::move(fields)) {
    // A record can be archived as soon as it exists.
    registerArchiveClass();
}

std::shared_ptr<const BundleRecord> BundleRecord::make(Fields fields) {
    return std::make_shared<const BundleRecord>(std::move(fields));
}

std::shared_ptr<const BundleRecord> BundleRecord::bundleRecordWithBundleIdentifier(
    const std::string& bundleIdentifier) {
    return AppRegistry::defaultRegistry()->recordForBundleIdentifier(bundleIdentifier);
}

void BundleRecord::registerArchiveClass() {
    static std::once_flag once;
    std::call_once(once, [] {
        ArchiveClassRegistry::shared().add(
            ArchiveClass{std::string(kClassName), {}, encodeRecord, decodeRecord});
    });
}

std::string BundleRecord::description() const {
    std::string text = "<BundleRecord " + fields_.bundleIdentifier.value_or("<unknown>");
    if (fields_.dataContainerURL)
        text += " container:" + fields_.dataContainerURL->path();
    return text + ">";
}

bool BundleRecord::isEqual(const Object& other) const {
    auto record = dynamic_cast<const BundleRecord*>(&other);
    if (!record)
        return false;
    const Fields& a = fields_;
    const Fields& b = record->fields_;
    auto sameURL = a.dataContainerURL.has_value() == b.dataContainerURL.has_value() &&
                   (!a.dataContainerURL || *a.dataContainerURL == *b.dataContainerURL);
    return a.bundleIdentifier == b.bundleIdentifier && a.localizedName == b.localizedName &&
           sameURL && a.iconName == b.iconName;
}

}  // namespace tamber
