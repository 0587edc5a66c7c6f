// The log lines a test captured, for layers that have the log.
#pragma once

#include <string>

#include "platform/log/CaptureSink.h"

namespace bexil::test {

// The captured lines as "<level>: <message>", one per line, in the order they were logged.
inline std::string capturedLog(const log::CaptureSink& capture) {
    std::string text;
    for (const auto& entry : capture.entries())
        text += std::string(log::levelName(entry.level)) + ": " + entry.message + "\n";
    return text;
}

}  // namespace bexil::test
