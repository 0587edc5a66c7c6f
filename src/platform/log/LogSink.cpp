#include "platform/log/LogSink.h"

namespace bexil::log {

const char* levelName(Level level) {
    switch (level) {
        case Level::Debug:
            return "debug";
        case Level::Info:
            return "info";
        case Level::Default:
            return "default";
        case Level::Error:
            return "error";
        case Level::Fault:
            return "fault";
    }
    return "unknown";
}

std::optional<Level> parseLevel(std::string_view text) {
    for (Level level : {Level::Debug, Level::Info, Level::Default, Level::Error, Level::Fault}) {
        if (text == levelName(level)) return level;
    }
    return std::nullopt;
}

int journalPriority(Level level) {
    switch (level) {
        case Level::Debug:
            return 7;
        case Level::Info:
            return 6;
        case Level::Default:
            return 5;
        case Level::Error:
            return 3;
        case Level::Fault:
            return 2;
    }
    return 5;
}

}  // namespace bexil::log
