#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "base/Value.h"
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

// The names BXD_LOG_LEVEL accepts (exactly, in lower case) and the journal priority of each level.
TEST(LogLevelTest, NamesParseBackAndEachLevelHasItsJournalPriority) {
    const std::pair<Level, int> levels[] = {
        {Level::Debug, 7}, {Level::Info, 6}, {Level::Default, 5}, {Level::Error, 3}, {Level::Fault, 2}};
    for (const auto& [level, priority] : levels) {
        EXPECT_EQ(parseLevel(levelName(level)), level);
        EXPECT_EQ(journalPriority(level), priority) << levelName(level);
    }
    EXPECT_FALSE(parseLevel("warning").has_value());
    EXPECT_FALSE(parseLevel("INFO").has_value());
}

// The setting decides what is enabled, and a disabled message is not even formatted; an unset setting means info,
// and so does an unknown one, which is reported once on the default log.
TEST(LogThresholdTest, LevelSettingDecidesWhatIsEnabledAndAnUnknownOneMeansInfoReportedOnce) {
    LogRegistry registry("error");
    EXPECT_FALSE(registry.ops().enabled(Level::Default));
    EXPECT_TRUE(registry.ops().enabled(Level::Error));
    std::atomic<int> calls{0};
    registry.ops().info("skipped %@", CountingObject{&calls});
    EXPECT_EQ(calls.load(), 0);
    EXPECT_EQ(LogRegistry(nullptr).threshold(), Level::Info);

    CaptureSink capture;
    LogRegistry loud("loud");
    EXPECT_EQ(loud.threshold(), Level::Info);
    loud.ops().info("first");
    loud.traffic().info("second");
    auto reports = capture.matching("BXD_LOG_LEVEL");
    ASSERT_EQ(reports.size(), 1u);
    EXPECT_EQ(reports[0].message,
              "unknown BXD_LOG_LEVEL value \"loud\" (expected debug, info, default, error or fault); using info");
    EXPECT_EQ(reports[0].level, Level::Error);
    EXPECT_EQ(reports[0].category, "");
}

// A line is "<UTC time to the microsecond> <level> <category or ->: <message>", one line per message (a newline
// inside is escaped), and standard error carries only what is at or above the threshold.
TEST(LogSinkTest, StreamLinesCarryTimeLevelCategoryAndOneMessageAtOrAboveTheThreshold) {
    std::string out = writtenThroughPipe([](int fd) {
        SystemLogSink sink(SystemLogSink::Destination::Stream, fd);
        sink.write(LogRecord{Level::Error, "com.quorvel.Bexil", "ops", "two\nlines", std::chrono::system_clock::now()});
        sink.write(LogRecord{Level::Info, "", "", "from the default log", std::chrono::system_clock::now()});
    });
    std::regex expected(
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z error ops: two\\\\nlines\n"
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z info -: from the default log\n");
    EXPECT_TRUE(std::regex_match(out, expected)) << out;

    if (SystemLogSink().destination() == SystemLogSink::Destination::Journal)
        GTEST_SKIP() << "messages go to the journal on this machine";
    LogRegistry registry("default");
    out = writtenThroughPipe([&](int fd) {
        int saved = dup(STDERR_FILENO);
        dup2(fd, STDERR_FILENO);
        registry.ops().info("below the threshold %d", 1);
        registry.lx().notice("at the threshold %d", 2);
        dup2(saved, STDERR_FILENO);
        close(saved);
    });
    EXPECT_EQ(out.find("below the threshold"), std::string::npos);
    EXPECT_NE(out.find(" default lx: at the threshold 2\n"), std::string::npos) << out;
}

// A capture sees every channel at every level, whatever the threshold, with its category and formatted text.
TEST(LogCaptureTest, RecordsLevelSubsystemCategoryAndFormattedText) {
    CaptureSink capture;
    LogRegistry registry("fault");
    registry.ops().debug("client %d requested %{public}s", 42, "match");
    registry.traffic().info("reply %@", Value::string("ok"));
    registry.extension().notice("rule %s", "x");
    registry.lx().error("registry %u", 3u);

    auto all = capture.entries();
    ASSERT_EQ(all.size(), 4u);
    EXPECT_EQ(all[0].level, Level::Debug);
    EXPECT_EQ(all[0].subsystem, "com.quorvel.Bexil");
    EXPECT_EQ(all[0].message, "client 42 requested match");
    EXPECT_EQ(all[1].message, "reply ok");
    EXPECT_EQ(all[2].level, Level::Default);
    EXPECT_EQ(all[3].level, Level::Error);
    std::vector<std::string> categories;
    for (const auto& entry : all) categories.push_back(entry.category);
    EXPECT_EQ(categories, (std::vector<std::string>{"ops", "traffic", "extension", "lx"}));
    EXPECT_EQ(capture.count("re"), 3u);  // "requested", "reply", "registry"
    capture.clear();
    EXPECT_TRUE(capture.entries().empty());
}

// A capture keeps what is at or above its own minimum, only while it lives; when it goes, the levels it enabled are
// disabled again.
TEST(LogCaptureTest, MinimumLevelAndLifetimeBoundWhatIsKept) {
    LogRegistry registry("fault");
    CaptureSink errorsOnly(Level::Error);
    {
        CaptureSink everything;
        registry.ops().debug("scoped debug");
        registry.ops().error("scoped error");
        EXPECT_EQ(everything.entries().size(), 2u);
    }
    registry.ops().error("after the scope");
    EXPECT_FALSE(errorsOnly.contains("scoped debug"));
    EXPECT_TRUE(errorsOnly.contains("scoped error"));
    EXPECT_TRUE(errorsOnly.contains("after the scope"));
    EXPECT_FALSE(registry.ops().enabled(Level::Debug));
}

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

// Losing a category must not lose its messages: they go to the default log, which says so once.
TEST(LogRegistryTest, RefusedCategoryFallsBackToTheDefaultLogAndSaysSo) {
    CaptureSink capture;
    auto refuseTraffic = [](const std::atomic<int>& threshold, std::string_view subsystem,
                            std::string_view category) -> std::unique_ptr<Channel> {
        if (category == "traffic") return nullptr;
        return LogRegistry::defaultFactory()(threshold, subsystem, category);
    };
    LogRegistry registry(nullptr, refuseTraffic);
    EXPECT_EQ(&registry.traffic(), &registry.defaultLog());
    EXPECT_NE(&registry.ops(), &registry.defaultLog());

    auto reports = capture.matching("unable to create lumen for category");
    ASSERT_EQ(reports.size(), 1u);
    EXPECT_EQ(reports[0].message, "unable to create lumen for category traffic");
    EXPECT_EQ(reports[0].level, Level::Error);
    EXPECT_EQ(reports[0].subsystem, "");

    registry.traffic().info("reply for %d", 7);
    auto reply = capture.find("reply for 7");
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ(reply->category, "");
    EXPECT_EQ(capture.count("unable to create lumen"), 1u);
}

}  // namespace
}  // namespace bexil::log
