#include "platform/log/SystemLogSink.h"

#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <string>

namespace bexil::log {

SystemLogSink::SystemLogSink()
    : destination_(access(kJournalSocket, W_OK) == 0 ? Destination::Journal : Destination::Stream),
      fd_(STDERR_FILENO) {}

SystemLogSink::SystemLogSink(Destination destination, int fd) : destination_(destination), fd_(fd) {}

void SystemLogSink::write(const LogRecord& record) {
    if (destination_ == Destination::Journal) {
        std::string message(record.message);
        int priority = journalPriority(record.level);
        int rc;
        if (record.subsystem.empty()) {
            rc = sd_journal_send("MESSAGE=%s", message.c_str(), "PRIORITY=%i", priority, nullptr);
        } else {
            std::string subsystem(record.subsystem), category(record.category);
            rc = sd_journal_send("MESSAGE=%s", message.c_str(), "PRIORITY=%i", priority, "BEXIL_SUBSYSTEM=%s",
                                 subsystem.c_str(), "BEXIL_CATEGORY=%s", category.c_str(), nullptr);
        }
        // A journal that went away must not swallow messages: they go to standard error instead.
        if (rc >= 0) return;
    }
    writeLine(record);
}

// "2026-11-23T10:03:25.123456Z info ops: message": one line per message, newlines inside the message escaped so
// that a reader (or grep) never sees half a message.
void SystemLogSink::writeLine(const LogRecord& record) {
    auto sinceEpoch = record.time.time_since_epoch();
    auto seconds = std::chrono::duration_cast<std::chrono::seconds>(sinceEpoch);
    auto micros = std::chrono::duration_cast<std::chrono::microseconds>(sinceEpoch - seconds).count();
    time_t t = static_cast<time_t>(seconds.count());
    struct tm tm {};
    gmtime_r(&t, &tm);
    char stamp[64];
    snprintf(stamp, sizeof stamp, "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ", tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
             tm.tm_hour, tm.tm_min, tm.tm_sec, static_cast<long>(micros));

    std::string line = stamp;
    line += ' ';
    line += levelName(record.level);
    line += ' ';
    line += record.category.empty() ? std::string_view("-") : record.category;
    line += ": ";
    for (char c : record.message) {
        if (c == '\n')
            line += "\\n";
        else if (c == '\r')
            line += "\\r";
        else
            line += c;
    }
    line += '\n';

    std::lock_guard lock(streamMutex_);
    const char* p = line.data();
    size_t left = line.size();
    while (left > 0) {
        ssize_t n = ::write(fd_, p, left);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return;  // nowhere left to report a failing log; dropping is all we can do
        p += n;
        left -= static_cast<size_t>(n);
    }
}

}  // namespace bexil::log
