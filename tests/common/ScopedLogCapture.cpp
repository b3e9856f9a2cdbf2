#include "tests/common/ScopedLogCapture.h"

namespace tamber::testing {

ScopedLogCapture::ScopedLogCapture()
    : sink_(std::make_shared<CaptureLogSink>()),
      previous_(Log::shared().setSink(sink_)),
      previousDebug_(Log::shared().debugEnabled()) {
    Log::shared().setDebugEnabled(true);
}

ScopedLogCapture::~ScopedLogCapture() {
    Log::shared().setSink(previous_);
    Log::shared().setDebugEnabled(previousDebug_);
}

}  // namespace tamber::testing
