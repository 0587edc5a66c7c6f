#pragma once

// A sink for tests: while it exists it receives every record at or above its minimum level (even below the
// system threshold, so debug lines can be checked without changing the environment), and keeps them for the test
// to search. Installing and removing are tied to its lifetime. Thread-safe.

#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/LogSink.h"

namespace bexil::log {

class CaptureSink : public LogSink {
  public:
    struct Entry {
        Level level;
        std::string subsystem;
        std::string category;
        std::string message;
    };

    explicit CaptureSink(Level minimum = Level::Debug);
    ~CaptureSink() override;
    CaptureSink(const CaptureSink&) = delete;
    CaptureSink& operator=(const CaptureSink&) = delete;

    Level minimum() const { return minimum_; }

    // A copy of everything captured so far, oldest first.
    std::vector<Entry> entries() const;
    // The entries whose message contains `text`.
    std::vector<Entry> matching(std::string_view text) const;
    // The first entry whose message contains `text`.
    std::optional<Entry> find(std::string_view text) const;
    size_t count(std::string_view text) const { return matching(text).size(); }
    bool contains(std::string_view text) const { return find(text).has_value(); }
    void clear();

    void write(const LogRecord& record) override;

  private:
    const Level minimum_;
    mutable std::mutex mutex_;
    std::vector<Entry> entries_;
};

}  // namespace bexil::log
