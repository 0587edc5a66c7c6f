#pragma once

// The pieces every log destination shares: the five levels, one record as a sink receives it, and the sink
// interface. Sinks are called from any thread and must be thread-safe themselves.

#include <chrono>
#include <optional>
#include <string_view>

namespace bexil::log {

// Ordered from least to most severe; a threshold lets through its own level and everything above it.
enum class Level { Debug, Info, Default, Error, Fault };

// "debug", "info", "default", "error", "fault".
const char* levelName(Level level);
// The inverse of levelName; none for any other text.
std::optional<Level> parseLevel(std::string_view text);
// The journal's priority for a level: debug 7, info 6, default 5, error 3, fault 2.
int journalPriority(Level level);

// One message on its way to the sinks. The views live only as long as the call to LogSink::write.
struct LogRecord {
    Level level;
    std::string_view subsystem;  // empty for the system's default log
    std::string_view category;   // empty for the system's default log
    std::string_view message;
    std::chrono::system_clock::time_point time;
};

class LogSink {
  public:
    virtual ~LogSink() = default;
    virtual void write(const LogRecord& record) = 0;
};

}  // namespace bexil::log
