#pragma once

// The process-wide set of log destinations: the system sink (journal or standard error) and any capturing sinks
// that tests have installed. Every channel hands its records here. Thread-safe; lives for the whole process.

#include <atomic>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/log/LogSink.h"

namespace bexil::log {

class CaptureSink;
class SystemLogSink;

class LogDispatcher {
  public:
    static LogDispatcher& shared();

    // True when an installed capture wants records of this level, whatever the system threshold says.
    bool captureWants(Level level) const {
        return static_cast<int>(level) >= captureMinimum_.load(std::memory_order_relaxed);
    }

    // Hands the record to every capture that wants it and, when `toSystem`, to the system sink.
    void dispatch(const LogRecord& record, bool toSystem);

  private:
    friend class CaptureSink;
    static constexpr int kNoCapture = static_cast<int>(Level::Fault) + 1;

    LogDispatcher();
    void install(CaptureSink* sink);
    void remove(CaptureSink* sink);
    void recomputeMinimumLocked();

    std::mutex mutex_;
    std::vector<CaptureSink*> captures_;
    std::atomic<int> captureMinimum_{kNoCapture};
    std::unique_ptr<SystemLogSink> system_;
};

}  // namespace bexil::log
