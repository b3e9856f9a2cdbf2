#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Url.h"
#include "platform/objects/Object.h"

namespace tamber {

// One installed application as the app-library cache stores it: bundle identifier, display
// name, data container and icon name. Immutable; archived by the keyed archiver under the class
// name "BundleRecord", every present field as a string (the data container as its path). The
// class is registered when the first record is made; call `registerArchiveClass` before
// unarchiving in a process that may not have made one. Decoding gives a plain BundleRecord,
// also for a subclass that was archived; a field of the wrong type, or a relative container
// path, fails the unarchive.
class BundleRecord : public Object {
public:
    static constexpr std::string_view kClassName = "BundleRecord";

    struct Fields {
        std::optional<std::string> bundleIdentifier;
        std::optional<std::string> localizedName;
        std::optional<Url> dataContainerURL;
        std::optional<std::string> iconName;
    };

    explicit BundleRecord(Fields fields);
    static std::shared_ptr<const BundleRecord> make(Fields fields);

    // The installed application with this bundle identifier, from the default registry.
    static std::shared_ptr<const BundleRecord> bundleRecordWithBundleIdentifier(
        const std::string& bundleIdentifier);

    // Registers the archive class once; safe to call from any thread, any number of times.
    static void registerArchiveClass();

    const std::optional<std::string>& bundleIdentifier() const { return fields_.bundleIdentifier; }
    const std::optional<std::string>& localizedName() const { return fields_.localizedName; }
    const std::optional<Url>& dataContainerURL() const { return fields_.dataContainerURL; }
    const std::optional<std::string>& iconName() const { return fields_.iconName; }
    const Fields& fields() const { return fields_; }

    std::string_view className() const override { return kClassName; }
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    Fields fields_;
};

using BundleRecordRef = std::shared_ptr<const BundleRecord>;

}  // namespace tamber
