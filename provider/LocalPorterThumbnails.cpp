#include <cstdio>
#include <new>

#include "host/ItemIdentifier.h"
#include "platform/apps/AppRecord.h"
#include "platform/apps/AppRegistry.h"
#include "platform/device/DeviceAnswer.h"
#include "platform/imaging/IconBitmap.h"
#include "platform/imaging/ImageEncoder.h"
#include "platform/objects/Number.h"
#include "provider/LocalPorter.h"
#include "support/Log.h"
#include "support/LogSection.h"
#include "support/MutexLock.h"

namespace tamber {

// Test hooks, declared by the tests that use them. The device answers are read once per
// process, so tests that vary them must drop the cached pair; AppRecord's icon look-up is not
// virtual, so tests that watch which variants are asked for route it through a source of their
// own (null restores the record's own look-up).
using IconVariantSource = std::function<std::optional<Bytes>(const AppRecord&, int variant)>;
void ResetThumbnailDeviceTraitsForTesting();
void SetIconVariantSourceForTesting(IconVariantSource source);

namespace {

struct DeviceTraits {
    bool tabletClass = false;
    double screenScale = 0;
};

// The two device answers, asked for once and kept for the life of the process.
struct DeviceTraitsCache {
    Mutex mutex;
    std::optional<DeviceTraits> traits GUARDED_BY(mutex);
};

DeviceTraitsCache& deviceTraitsCache() {
    static DeviceTraitsCache cache;
    return cache;
}

DeviceTraits deviceTraits() {
    auto& cache = deviceTraitsCache();
    MutexLock lock(cache.mutex);
    if (!cache.traits) {
        DeviceTraits traits;
        auto deviceClass =
            std::dynamic_pointer_cast<const Number>(CopyDeviceAnswer("DeviceClassNumber"));
        traits.tabletClass = deviceClass && deviceClass->int64Value() == kDeviceClassTablet;
        // The answer is a single-precision value: keep exactly what it says, widened.
        auto scale = std::dynamic_pointer_cast<const Number>(CopyDeviceAnswer("main-screen-scale"));
        traits.screenScale =
            scale ? static_cast<double>(static_cast<float>(scale->doubleValue())) : 0.0;
        cache.traits = traits;
    }
    return *cache.traits;
}

struct IconVariantSourceSlot {
    Mutex mutex;
    IconVariantSource source GUARDED_BY(mutex);
};

IconVariantSourceSlot& iconVariantSourceSlot() {
    static IconVariantSourceSlot slot;
    return slot;
}

std::optional<Bytes> iconDataForVariant(const AppRecord& record, int variant) {
    IconVariantSource source;
    {
        auto& slot = iconVariantSourceSlot();
        MutexLock lock(slot.mutex);
        source = slot.source;
    }
    return source ? source(record, variant) : record.iconDataForVariant(variant);
}

int iconVariantForScale(double scale, bool tabletClass) {
    if (scale == 3.0)
        return 32;
    if (scale == 2.0)
        return tabletClass ? 24 : 15;
    return tabletClass ? 1 : 0;
}

// At scale 1.0 the variant no longer changes, so asking again can only help if the icon shows
// up in the meantime. On Linux many applications install no icon at all, and this runs on a
// host thread that must not hang: give the last variant a few tries, then give up.
constexpr int kAttemptsAtLowestScale = 3;

std::string formatScale(double scale) {
    char text[32];
    std::snprintf(text, sizeof text, "%.1f", scale);
    return text;
}

// Why bestIconData came back empty, for the log line.
std::string missingIconReason(const AppRecord& record) {
    double scale = deviceTraits().screenScale;
    if (scale < 1.0)
        return "screen scale " + formatScale(scale) + " is below 1.0";
    if (!record.iconName())
        return "the application names no icon";
    return "no icon \"" + *record.iconName() + "\" for screen scale " + formatScale(scale);
}

std::string identifierList(const std::vector<HostPorterItemIdentifier>& identifiers) {
    std::string list = "[";
    for (size_t i = 0; i < identifiers.size(); ++i) {
        if (i > 0)
            list += ", ";
        list += identifiers[i];
    }
    return list + "]";
}

// The PNG of one item's thumbnail, or nothing; every step that fails writes one line.
std::optional<Bytes> thumbnailFor(LocalPorter& porter, const HostPorterItemIdentifier& identifier) {
    // Files and folders are shown with the browser's own icons.
    auto parsed = ItemIdentifier::parse(identifier);
    if (!parsed.isAppLibrary())
        return std::nullopt;
    const std::string& bundleIdentifier = parsed.bundleIdentifier();
    auto record = std::dynamic_pointer_cast<const AppRecord>(
        AppRegistry::defaultRegistry()->recordForBundleIdentifier(bundleIdentifier));
    if (!record) {
        logDebug(identifier + ": can't get app proxy for " + bundleIdentifier);
        return std::nullopt;
    }
    auto iconData = porter.bestIconData(*record);
    if (!iconData) {
        // An application without an icon is ordinary on Linux.
        logDebug(identifier + ": can't get primary icon data; " + missingIconReason(*record));
        return std::nullopt;
    }
    auto image = CreateIconFromCachedBitmap(*iconData);
    if (!image) {
        logError(identifier + ": can't create icon from cached bitmap");
        return std::nullopt;
    }
    std::shared_ptr<Bytes> buffer;
    try {
        buffer = std::make_shared<Bytes>();
    } catch (const std::bad_alloc&) {
        logError(identifier + ": can't create new data");
        return std::nullopt;
    }
    auto encoder = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
    if (!encoder) {
        logError(identifier + ": can't create image from new data");
        return std::nullopt;
    }
    encoder->addImage(image);
    if (!encoder->finalize()) {
        logError(identifier + ": can't finalize image");
        return std::nullopt;
    }
    logDebug(
        [&] { return identifier + ": returning " + std::to_string(buffer->size()) + " bytes"; });
    return std::move(*buffer);
}

}  // namespace

void ResetThumbnailDeviceTraitsForTesting() {
    auto& cache = deviceTraitsCache();
    MutexLock lock(cache.mutex);
    cache.traits.reset();
}

void SetIconVariantSourceForTesting(IconVariantSource source) {
    auto& slot = iconVariantSourceSlot();
    MutexLock lock(slot.mutex);
    slot.source = std::move(source);
}

std::optional<Bytes> LocalPorter::bestIconData(const AppRecord& record) {
    auto [tabletClass, scale] = deviceTraits();
    int attemptsAtLowestScale = 0;
    while (scale >= 1.0) {
        if (auto data = iconDataForVariant(record, iconVariantForScale(scale, tabletClass)))
            return data;
        if (scale > 1.0)
            scale -= 1.0;
        else if (++attemptsAtLowestScale == kAttemptsAtLowestScale)
            break;
    }
    return std::nullopt;
}

void LocalPorter::fetchThumbnailsForItemIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers, ThumbnailSize,
    PerThumbnailCompletion perThumbnailCompletion, ErrorCompletion completion) {
    withLogSection("fetching thumbnails for " + identifierList(identifiers), [&] {
        for (const auto& identifier : identifiers)
            perThumbnailCompletion(identifier, thumbnailFor(*this, identifier), std::nullopt);
        completion(Status::OK());
    });
}

void LocalPorter::fetchThumbnailsForItemIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers, ThumbnailSize,
    PerThumbnailCompletionWithType perThumbnailCompletion, ErrorCompletion completion) {
    withLogSection("fetching thumbnails for " + identifierList(identifiers), [&] {
        // Every thumbnail is a PNG, also the slot of one that could not be made.
        const std::string type(ImageEncoder::kPNGType);
        for (const auto& identifier : identifiers)
            perThumbnailCompletion(identifier, thumbnailFor(*this, identifier), type, std::nullopt);
        completion(Status::OK());
    });
}

}  // namespace tamber
