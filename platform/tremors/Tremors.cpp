#include "platform/tremors/Tremors.h"

#include <utility>

#include "platform/tremors/TremorService.h"
#include "support/Log.h"

namespace tamber {

namespace {

TremorStreamRef createStream(TremorStream::Options options) {
    auto service = TremorService::shared();
    if (!service.ok()) {
        logError("The event journal could not start: " + service.error().description());
        return nullptr;
    }
    auto stream = TremorStream::create(service.value(), std::move(options));
    if (!stream)
        return nullptr;
    TremorStreamRef ref = stream.get();
    ref->retainHandle(std::move(stream));
    return ref;
}

}  // namespace

namespace {

TremorStream::Options streamOptions(TremorStreamCallback callback,
                                    const TremorStreamContext* context,
                                    const std::vector<std::string>& paths, uint64_t sinceWhen,
                                    double latencySeconds, uint32_t flags) {
    TremorStream::Options options;
    options.callback = callback;
    if (context)
        options.context = *context;
    options.paths = paths;
    options.since = sinceWhen;
    options.latency = latencySeconds;
    options.flags = flags;
    return options;
}

}  // namespace

TremorStreamRef TremorStreamCreate(TremorStreamCallback callback,
                                   const TremorStreamContext* context,
                                   const std::vector<std::string>& pathsToWatch, uint64_t sinceWhen,
                                   double latencySeconds, uint32_t flags) {
    return createStream(
        streamOptions(callback, context, pathsToWatch, sinceWhen, latencySeconds, flags));
}

TremorStreamRef TremorStreamCreateWithEvents(TremorStream::EventsCallback callback,
                                             std::optional<uint32_t> device,
                                             const std::vector<std::string>& paths,
                                             uint64_t sinceWhen, double latencySeconds,
                                             uint32_t flags) {
    if (!callback)
        return nullptr;
    TremorStream::Options options =
        streamOptions(nullptr, nullptr, paths, sinceWhen, latencySeconds, flags);
    options.events = std::move(callback);
    options.device = device;
    return createStream(std::move(options));
}

TremorStreamRef TremorStreamCreateRelativeToDevice(
    TremorStreamCallback callback, const TremorStreamContext* context, uint32_t device,
    const std::vector<std::string>& pathsRelativeToDevice, uint64_t sinceWhen,
    double latencySeconds, uint32_t flags) {
    TremorStream::Options options =
        streamOptions(callback, context, pathsRelativeToDevice, sinceWhen, latencySeconds, flags);
    options.device = device;
    return createStream(std::move(options));
}

void TremorStreamSetDispatchQueue(TremorStreamRef stream, std::shared_ptr<DispatchQueue> queue) {
    if (stream)
        stream->setDispatchQueue(std::move(queue));
}

bool TremorStreamStart(TremorStreamRef stream) {
    return stream && stream->start();
}

void TremorStreamStop(TremorStreamRef stream) {
    if (stream)
        stream->stop();
}

void TremorStreamInvalidate(TremorStreamRef stream) {
    if (stream)
        stream->invalidate();
}

void TremorStreamRelease(TremorStreamRef stream) {
    if (stream)
        stream->releaseHandle();
}

uint64_t TremorsGetCurrentEventId() {
    auto service = TremorService::shared();
    return service.ok() ? service.value()->currentEventId() : 0;
}

std::string TremorsCopyUUIDForDevice(uint32_t device) {
    auto service = TremorService::shared();
    return service.ok() ? service.value()->uuidForDevice(device) : std::string();
}

}  // namespace tamber
