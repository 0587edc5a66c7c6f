#pragma once

// One log handle: a subsystem and category that every message written through it carries. Messages are the
// system's printf-style texts, checked at compile time and formatted only when some sink will take them. Channels
// are made by a LogRegistry, which owns them for the life of the process; any thread may use one.

#include <atomic>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

#include "base/Format.h"
#include "platform/log/LogDispatcher.h"
#include "platform/log/LogSink.h"

namespace bexil::log {

class Channel {
  public:
    // `threshold` is the level (as an int) below which the system sink takes nothing; it must outlive the channel.
    Channel(const std::atomic<int>& threshold, std::string subsystem, std::string category);
    Channel(const Channel&) = delete;
    Channel& operator=(const Channel&) = delete;

    // Empty for the system's default log.
    const std::string& subsystem() const { return subsystem_; }
    const std::string& category() const { return category_; }

    // Whether a message of this level would reach any sink; nothing is formatted when it would not.
    bool enabled(Level level) const {
        return static_cast<int>(level) >= threshold_.load(std::memory_order_relaxed) ||
               LogDispatcher::shared().captureWants(level);
    }

    template <class... A>
    void debug(FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        emit<A...>(Level::Debug, format, std::forward<A>(args)...);
    }
    template <class... A>
    void info(FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        emit<A...>(Level::Info, format, std::forward<A>(args)...);
    }
    // The "default" level.
    template <class... A>
    void notice(FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        emit<A...>(Level::Default, format, std::forward<A>(args)...);
    }
    template <class... A>
    void error(FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        emit<A...>(Level::Error, format, std::forward<A>(args)...);
    }
    template <class... A>
    void fault(FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        emit<A...>(Level::Fault, format, std::forward<A>(args)...);
    }

    // Writes an already formatted message (for texts known only at run time, see formatPrintfRuntime).
    void write(Level level, std::string_view message) const;

  private:
    template <class... A>
    void emit(Level level, FormatString<std::type_identity_t<A>...> format, A&&... args) const {
        if (!enabled(level)) return;
        write(level, formatPrintf<A...>(format, std::forward<A>(args)...));
    }

    const std::atomic<int>& threshold_;
    const std::string subsystem_;
    const std::string category_;
};

}  // namespace bexil::log
