#pragma once

// The sink that production messages reach: the systemd journal, with the subsystem and category as fields of their
// own, or, when no journal is reachable (a container, a test run, an unprivileged shell), one line per message on
// standard error. Safe to call from any thread.

#include <mutex>

#include "platform/log/LogSink.h"

namespace bexil::log {

class SystemLogSink : public LogSink {
  public:
    enum class Destination { Journal, Stream };

    // Chooses the journal when its socket is writable, otherwise standard error.
    SystemLogSink();
    // A fixed destination; Stream writes to the given file descriptor (tests pass a pipe).
    SystemLogSink(Destination destination, int fd);

    Destination destination() const { return destination_; }
    void write(const LogRecord& record) override;

    // The socket whose writability decides for the journal.
    static constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

  private:
    void writeLine(const LogRecord& record);

    Destination destination_;
    int fd_;
    std::mutex streamMutex_;
};

}  // namespace bexil::log
