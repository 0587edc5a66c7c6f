#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
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

// Runs `body` with standard error redirected to a file and returns what was written there.
template <class F>
std::string captureStandardError(F body) {
    char path[] = "/tmp/bexil-log-test-XXXXXX";
    int file = mkstemp(path);
    EXPECT_GE(file, 0);
    unlink(path);
    int saved = dup(STDERR_FILENO);
    dup2(file, STDERR_FILENO);
    body();
    dup2(saved, STDERR_FILENO);
    close(saved);
    std::string out;
    char buf[4096];
    lseek(file, 0, SEEK_SET);
    for (ssize_t n; (n = read(file, buf, sizeof buf)) > 0;) out.append(buf, static_cast<size_t>(n));
    close(file);
    return out;
}

TEST(LogLevelTest, NamesAndJournalPriorities) {
    for (Level level : {Level::Debug, Level::Info, Level::Default, Level::Error, Level::Fault})
        EXPECT_EQ(parseLevel(levelName(level)), level);
    EXPECT_FALSE(parseLevel("warning").has_value());
    EXPECT_FALSE(parseLevel("INFO").has_value());
    EXPECT_EQ(journalPriority(Level::Debug), 7);
    EXPECT_EQ(journalPriority(Level::Info), 6);
    EXPECT_EQ(journalPriority(Level::Default), 5);
    EXPECT_EQ(journalPriority(Level::Error), 3);
    EXPECT_EQ(journalPriority(Level::Fault), 2);
}

TEST(LogThresholdTest, LevelSettingDecidesWhatIsEnabledAndFormattedAndAnUnknownOneMeansInfoReportedOnce) {
    LogRegistry registry("error");
    EXPECT_EQ(registry.threshold(), Level::Error);
    EXPECT_FALSE(registry.ops().enabled(Level::Info));
    EXPECT_FALSE(registry.ops().enabled(Level::Default));
    EXPECT_TRUE(registry.ops().enabled(Level::Error));
    EXPECT_TRUE(registry.ops().enabled(Level::Fault));

    std::atomic<int> calls{0};
    registry.ops().info("skipped %@", CountingObject{&calls});
    EXPECT_EQ(calls.load(), 0);

    EXPECT_EQ(LogRegistry(nullptr).threshold(), Level::Info);
    EXPECT_EQ(LogRegistry("").threshold(), Level::Info);
    EXPECT_EQ(LogRegistry("debug").threshold(), Level::Debug);
    EXPECT_EQ(LogRegistry("fault").threshold(), Level::Fault);

    CaptureSink capture;
    LogRegistry loud("loud");
    EXPECT_EQ(loud.threshold(), Level::Info);
    loud.ops().info("first");
    loud.traffic().info("second");
    auto reports = capture.matching("BXD_LOG_LEVEL");
    ASSERT_EQ(reports.size(), 1u);
    EXPECT_EQ(reports[0].level, Level::Error);
    EXPECT_NE(reports[0].message.find("\"loud\""), std::string::npos);
    EXPECT_EQ(reports[0].category, "");

    CaptureSink quiet;
    LogRegistry fine("default");
    EXPECT_FALSE(quiet.contains("BXD_LOG_LEVEL"));
}

TEST(LogThresholdTest, StandardErrorCarriesOnlyMessagesAtOrAboveTheThreshold) {
    if (SystemLogSink().destination() == SystemLogSink::Destination::Journal)
        GTEST_SKIP() << "messages go to the journal on this machine";
    LogRegistry registry("default");
    std::string out = captureStandardError([&] {
        registry.ops().info("below the threshold %d", 1);
        registry.ops().notice("at the threshold %d", 2);
        registry.lx().error("above the threshold %s", "x");
    });
    EXPECT_EQ(out.find("below the threshold"), std::string::npos);
    EXPECT_NE(out.find(" default ops: at the threshold 2\n"), std::string::npos);
    EXPECT_NE(out.find(" error lx: above the threshold x\n"), std::string::npos);
}

TEST(LogSinkTest, StreamLinesCarryTimeLevelCategoryAndOneMessage) {
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    SystemLogSink sink(SystemLogSink::Destination::Stream, fds[1]);
    sink.write(LogRecord{Level::Error, "com.quorvel.Bexil", "ops", "two\nlines", std::chrono::system_clock::now()});
    sink.write(LogRecord{Level::Info, "", "", "from the default log", std::chrono::system_clock::now()});
    close(fds[1]);
    std::string out;
    char buf[512];
    for (ssize_t n; (n = read(fds[0], buf, sizeof buf)) > 0;) out.append(buf, static_cast<size_t>(n));
    close(fds[0]);
    std::regex expected(
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z error ops: two\\\\nlines\n"
        "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z info -: from the default log\n");
    EXPECT_TRUE(std::regex_match(out, expected)) << out;
}

TEST(LogCaptureTest, RecordsLevelSubsystemCategoryAndFormattedText) {
    CaptureSink capture;
    LogRegistry registry("fault");  // the capture sees debug lines even though the system sink would not
    registry.ops().debug("client %d requested %{public}s", 42, "match");
    registry.traffic().info("reply %@", Value::string("ok"));
    registry.extension().notice("rule %s", "x");
    registry.lx().error("registry %u", 3u);
    registry.ops().fault("broken %d", 1);

    auto all = capture.entries();
    ASSERT_EQ(all.size(), 5u);
    EXPECT_EQ(all[0].level, Level::Debug);
    EXPECT_EQ(all[0].subsystem, "com.quorvel.Bexil");
    EXPECT_EQ(all[0].category, "ops");
    EXPECT_EQ(all[0].message, "client 42 requested match");
    EXPECT_EQ(all[1].category, "traffic");
    EXPECT_EQ(all[1].message, "reply ok");
    EXPECT_EQ(all[2].level, Level::Default);
    EXPECT_EQ(all[2].category, "extension");
    EXPECT_EQ(all[3].category, "lx");
    EXPECT_EQ(all[4].level, Level::Fault);
    EXPECT_TRUE(capture.contains("broken 1"));
    EXPECT_EQ(capture.count("re"), 3u);  // "requested", "reply", "registry"
    EXPECT_FALSE(capture.contains("absent"));
    capture.clear();
    EXPECT_TRUE(capture.entries().empty());
}

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
    // With only an error-level capture left, debug is disabled again and formats nothing.
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

TEST(LogRegistryTest, ChannelsAreCreatedTogetherOnceOnFirstUse) {
    std::atomic<int> made{0};
    auto counting = [&](const std::atomic<int>& threshold, std::string_view subsystem, std::string_view category) {
        ++made;
        return LogRegistry::defaultFactory()(threshold, subsystem, category);
    };
    LogRegistry registry(nullptr, counting);
    EXPECT_EQ(made.load(), 0);  // nothing before the first use

    Channel& (LogRegistry::*const channels[])() = {&LogRegistry::ops, &LogRegistry::traffic, &LogRegistry::extension,
                                                   &LogRegistry::lx};
    std::vector<std::thread> threads;
    std::vector<Channel*> seen(8);
    for (size_t t = 0; t < 8; ++t) threads.emplace_back([&, t] { seen[t] = &(registry.*channels[t % 4])(); });
    for (auto& th : threads) th.join();
    EXPECT_EQ(made.load(), 4);
    for (size_t t = 0; t < 4; ++t) EXPECT_EQ(seen[t], seen[t + 4]);
    EXPECT_EQ(registry.ops().category(), "ops");
    EXPECT_EQ(registry.traffic().category(), "traffic");
    EXPECT_EQ(registry.extension().category(), "extension");
    EXPECT_EQ(registry.lx().category(), "lx");
    EXPECT_EQ(registry.lx().subsystem(), "com.quorvel.Bexil");
    EXPECT_EQ(made.load(), 4);
}

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
    EXPECT_EQ(reports[0].category, "");
    EXPECT_EQ(reports[0].subsystem, "");

    // The channel keeps working, its messages now on the default log.
    registry.traffic().info("reply for %d", 7);
    auto reply = capture.find("reply for 7");
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ(reply->category, "");
    registry.traffic();
    EXPECT_EQ(capture.count("unable to create lumen"), 1u);
}

TEST(LogRegistryTest, ProcessWideChannelsAreStable) {
    EXPECT_EQ(&ops(), &ops());
    EXPECT_EQ(ops().category(), "ops");
    EXPECT_EQ(lx().subsystem(), "com.quorvel.Bexil");
    EXPECT_EQ(defaultLog().category(), "");
    CaptureSink capture;
    ops().info("client %d requested %{public}s", 9, "lock");
    EXPECT_TRUE(capture.contains("client 9 requested lock"));
}

}  // namespace
}  // namespace bexil::log
