#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "platform/apps/BundleRecord.h"
#include "platform/objects/Data.h"
#include "platform/objects/Dictionary.h"

namespace tamber {

// A bundle record that the registry knows to be an application, with what decides whether it
// publishes documents. Archived as a plain BundleRecord.
class AppRecord : public BundleRecord {
public:
    struct AppFields {
        bool supportsOpenInPlace = false;
        bool fileSharingEnabled = false;
        // Holds "HostSupportsDocumentBrowser" (a boolean Number) when the entry sets it.
        std::shared_ptr<const Dictionary> infoDictionary;
    };

    AppRecord(Fields fields, AppFields appFields);
    static std::shared_ptr<const AppRecord> make(Fields fields, AppFields appFields);

    bool supportsOpenInPlace() const { return app_.supportsOpenInPlace; }
    bool fileSharingEnabled() const { return app_.fileSharingEnabled; }
    const std::shared_ptr<const Dictionary>& infoDictionary() const { return app_.infoDictionary; }

    // The bytes of the app's icon (a PNG file) for an icon variant, or nothing: the entry's
    // icon name looked up in the hicolor theme at the variant's pixel size (the nearest size
    // installed), or the file itself when the name is an absolute path. Variants: 0 -> 32 px,
    // 1 -> 48, 15 -> 64, 24 -> 96, 32 -> 96; other variants have no icon.
    std::optional<Bytes> iconDataForVariant(int variant) const;
    static std::optional<uint32_t> iconPixelSizeForVariant(int variant);

private:
    AppFields app_;
};

}  // namespace tamber
