#include "platform/log/LogDispatcher.h"

#include <algorithm>

#include "platform/log/CaptureSink.h"
#include "platform/log/SystemLogSink.h"

namespace bexil::log {

LogDispatcher& LogDispatcher::shared() {
    // Never destroyed: code running during exit may still log.
    static LogDispatcher* dispatcher = new LogDispatcher;
    return *dispatcher;
}

LogDispatcher::LogDispatcher() : system_(std::make_unique<SystemLogSink>()) {}

void LogDispatcher::dispatch(const LogRecord& record, bool toSystem) {
    if (captureWants(record.level)) {
        std::lock_guard lock(mutex_);
        for (CaptureSink* sink : captures_) {
            if (record.level >= sink->minimum()) sink->write(record);
        }
    }
    // The system sink serialises its own writes; holding our lock across a journal send would only add waiting.
    if (toSystem) system_->write(record);
}

void LogDispatcher::install(CaptureSink* sink) {
    std::lock_guard lock(mutex_);
    captures_.push_back(sink);
    recomputeMinimumLocked();
}

void LogDispatcher::remove(CaptureSink* sink) {
    std::lock_guard lock(mutex_);
    captures_.erase(std::remove(captures_.begin(), captures_.end(), sink), captures_.end());
    recomputeMinimumLocked();
}

void LogDispatcher::recomputeMinimumLocked() {
    int minimum = kNoCapture;
    for (CaptureSink* sink : captures_) minimum = std::min(minimum, static_cast<int>(sink->minimum()));
    captureMinimum_.store(minimum, std::memory_order_relaxed);
}

}  // namespace bexil::log
