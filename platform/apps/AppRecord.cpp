#include "platform/apps/AppRecord.h"

#include "platform/FileContents.h"
#include "platform/imaging/IconTheme.h"

namespace tamber {

AppRecord::AppRecord(Fields fields, AppFields appFields)
    : BundleRecord(std::move(fields)), app_(std::move(appFields)) {}

std::shared_ptr<const AppRecord> AppRecord::make(Fields fields, AppFields appFields) {
    return std::make_shared<const AppRecord>(std::move(fields), std::move(appFields));
}

std::optional<uint32_t> AppRecord::iconPixelSizeForVariant(int variant) {
    // A variant names a screen scale and device class: 0 at 1x, 1 at 1x on a tablet, 15 at 2x,
    // 24 at 2x on a tablet, 32 at 3x. The size is the 1x size (32 px, 48 on a tablet) times the
    // scale.
    switch (variant) {
        case 0:
            return 32;
        case 1:
            return 48;
        case 15:
            return 64;
        case 24:
            return 96;
        case 32:
            return 96;
        default:
            return std::nullopt;
    }
}

std::optional<Bytes> AppRecord::iconDataForVariant(int variant) const {
    auto size = iconPixelSizeForVariant(variant);
    const auto& name = iconName();
    if (!size || !name || name->empty())
        return std::nullopt;
    std::optional<std::string> path =
        name->starts_with('/') ? std::optional(*name) : IconTheme::pathForIcon(*name, *size);
    if (!path)
        return std::nullopt;
    auto bytes = FileContents::read(Url::fileURLWithPath(*path));
    if (!bytes.ok() || bytes->empty())
        return std::nullopt;
    return std::move(bytes).value();
}

}  // namespace tamber
