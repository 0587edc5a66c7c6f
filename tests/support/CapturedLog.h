// The log lines a test captured, for layers that have the log.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/log/CaptureSink.h"

namespace bexil::test {

// The captured lines as "<level>: <message>", one per line, in the order they were logged.
inline std::string capturedLog(const log::CaptureSink& capture) {
    std::string text;
    for (const auto& entry : capture.entries())
        text += std::string(log::levelName(entry.level)) + ": " + entry.message + "\n";
    return text;
}

// The first captured line whose message contains `text`, as "<level> <category>: <message>", or "" when none does;
// one comparison then checks a line's level, category and exact text.
inline std::string capturedLine(const log::CaptureSink& capture, std::string_view text) {
    std::optional<log::CaptureSink::Entry> entry = capture.find(text);
    if (!entry) return "";
    return std::string(log::levelName(entry->level)) + " " + entry->category + ": " + entry->message;
}

}  // namespace bexil::test
