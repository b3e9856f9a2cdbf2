#pragma once

#include <memory>

#include "support/CaptureLogSink.h"
#include "support/Log.h"

namespace tamber::testing {

// Routes the log to a capturing sink (debug lines included) for the lifetime of the object.
class ScopedLogCapture {
public:
    ScopedLogCapture();
    ~ScopedLogCapture();
    ScopedLogCapture(const ScopedLogCapture&) = delete;
    ScopedLogCapture& operator=(const ScopedLogCapture&) = delete;

    CaptureLogSink& sink() { return *sink_; }
    CaptureLogSink* operator->() { return sink_.get(); }

private:
    std::shared_ptr<CaptureLogSink> sink_;
    std::shared_ptr<LogSink> previous_;
    bool previousDebug_;
};

}  // namespace tamber::testing
