#pragma once

#include <memory>

#include "platform/apps/BundleRecord.h"
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

private:
    AppFields app_;
};

}  // namespace tamber
