#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "bexil/Value.h"
#include "platform/log/CaptureSink.h"
#include "platform/log/Log.h"
#include "platform/log/SystemLogSink.h"

namespace bexil::log {
namespace {

// Counts how often the formatter asked for its description, to prove that disabled levels format nothing.
struct CountingObject {
    std::atomic<int>* calls;
    std::string description() const {
        ++*calls;
        return "counted";
    }
};

// Everything written to the descriptor that `body` gets, read back after `body` closed it.
template <class F>
std::string writtenThroughPipe(F body) {
    int fds[2];
    EXPECT_EQ(pipe(fds), 0);
    body(fds[1]);
    close(fds[1]);
    std::string out;
    char buf[512];
    for (ssize_t n; (n = read(fds[0], buf, sizeof buf)) > 0;) out.append(buf, static_cast<size_t>(n));
    close(fds[0]);
    return out;
}

// The setting decides what is enabled, and a disabled message is not even formatted; an unset setting means info,
// and so does an unknown one (names are exact and lower case), which is reported once on the default log.
TEST(LogThresholdTest, LevelSettingDecidesWhatIsEnabledAndAnUnknownOneMeansInfoReportedOnce) {
    LogRegistry registry("error");
    EXPECT_FALSE(registry.ops().enabled(Level::Default));
    EXPECT_TRUE(registry.ops().enabled(Level::Error));
    std::atomic<int> calls{0};
    registry.ops().info("skipped %@", CountingObject{&calls});
    EXPECT_EQ(calls.load(), 0);
    EXPECT_EQ(LogRegistry(nullptr).threshold(), Level::Info);

    CaptureSink capture;
    LogRegistry loud("INFO");
    EXPECT_EQ(loud.threshold(), Level::Info);
    loud.ops().info("first");
    loud.traffic().info("second");
    auto reports = capture.matching("BXD_LOG_LEVEL");
    ASSERT_EQ(reports.size(), 1u);
    EXPECT_EQ(reports[0].message,
              "unknown BXD_LOG_LEVEL value \"INFO\" (expected debug, info, default, error or fault); using info");
}

// A line is "<UTC time to the microsecond> <level> <category or ->: <message>", one line per message (a newline
// inside is escaped), so that whoever reads the daemon's standard error can split and grep it.
TEST(LogSinkTest, StreamLinesCarryTimeLevelCategoryAndOneMessage) {
    std::string out = writtenThroughPipe([](int fd) {
        SystemLogSink sink(SystemLogSink::Destination::Stream, fd);
        sink.write(LogRecord{Level::Error, "com.quorvel.Bexil", "ops", "two\nlines", std::chrono::system_clock::now()});
        sink.write(LogRecord{Level::Info, "", "", "from the default log", std::chrono::system_clock::now()});
    });
    std::regex expected(
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z error ops: two\\\\nlines\n"
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z info -: from the default log\n");
    EXPECT_TRUE(std::regex_match(out, expected)) << out;
}

// Writers on several threads must neither lose messages nor interleave their text.
TEST(LogCaptureTest, ConcurrentWritersLoseAndTearNothing) {
    CaptureSink capture;
    LogRegistry registry("fault");
    constexpr int kThreads = 8, kPerThread = 250;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            Channel& channel = (t % 2) ? registry.ops() : registry.traffic();
            for (int i = 0; i < kPerThread; ++i) channel.info("thread %d message %d end", t, i);
        });
    }
    for (auto& th : threads) th.join();
    auto all = capture.entries();
    ASSERT_EQ(all.size(), static_cast<size_t>(kThreads * kPerThread));
    std::vector<int> perThread(kThreads, 0);
    std::regex shape("thread (\\d) message (\\d+) end");
    for (const auto& e : all) {
        std::smatch m;
        ASSERT_TRUE(std::regex_match(e.message, m, shape)) << e.message;
        ++perThread[static_cast<size_t>(std::stoi(m[1]))];
    }
    for (int n : perThread) EXPECT_EQ(n, kPerThread);
}

// Threads racing to first use must make each channel once and all get the same one.
TEST(LogRegistryTest, ChannelsAreCreatedTogetherOnceOnFirstUse) {
    std::atomic<int> made{0};
    auto counting = [&](const std::atomic<int>& threshold, std::string_view subsystem, std::string_view category) {
        ++made;
        return LogRegistry::defaultFactory()(threshold, subsystem, category);
    };
    LogRegistry registry(nullptr, counting);
    EXPECT_EQ(made.load(), 0);

    Channel& (LogRegistry::*const channels[])() = {&LogRegistry::ops, &LogRegistry::traffic, &LogRegistry::extension,
                                                   &LogRegistry::lx};
    std::vector<std::thread> threads;
    std::vector<Channel*> seen(8);
    for (size_t t = 0; t < 8; ++t) threads.emplace_back([&, t] { seen[t] = &(registry.*channels[t % 4])(); });
    for (auto& th : threads) th.join();
    EXPECT_EQ(made.load(), 4);
    for (size_t t = 0; t < 4; ++t) EXPECT_EQ(seen[t], seen[t + 4]);
}

}  // namespace
}  // namespace bexil::log
