#pragma once

// The log as a fuzz target wants it: every message of every level is formatted, so that what an input puts into a
// message goes through the formatter, but only faults are written out (writing every line would cost more than the
// work it reports). A fault marks a broken invariant that the code survived; the target fails the input on it.
// One per process, made before the first input.

#include <optional>
#include <string>

#include "platform/log/CaptureSink.h"
#include "platform/log/Log.h"

namespace bexil::fuzz {

class LogCheck {
  public:
    LogCheck() : capture_(log::Level::Debug) { log::LogRegistry::shared().setThreshold(log::Level::Fault); }

    // The first fault logged since the last call, if there was one; forgets everything logged so far.
    std::optional<std::string> takeFault() {
        std::optional<std::string> fault;
        for (const log::CaptureSink::Entry& entry : capture_.entries()) {
            if (entry.level == log::Level::Fault) {
                fault = entry.message;
                break;
            }
        }
        capture_.clear();
        return fault;
    }

  private:
    log::CaptureSink capture_;
};

}  // namespace bexil::fuzz
