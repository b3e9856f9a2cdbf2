#include "platform/apps/AppRecord.h"

namespace tamber {

AppRecord::AppRecord(Fields fields, AppFields appFields)
    : BundleRecord(std::move(fields)), app_(std::move(appFields)) {}

std::shared_ptr<const AppRecord> AppRecord::make(Fields fields, AppFields appFields) {
    return std::make_shared<const AppRecord>(std::move(fields), std::move(appFields));
}

}  // namespace tamber
