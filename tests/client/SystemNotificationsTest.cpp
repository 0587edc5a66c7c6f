// System notifications across processes: a child process posts, the parent observes through inotify.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <future>

#include "TestSupport.h"
#include "base/EventLoop.h"
#include "base/SerialQueue.h"
#include "platform/notify/SystemNotifications.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

class SystemNotificationsTest : public ::testing::Test {
  protected:
    // Forks a child that posts each of `names` in turn and exits 0 when every post succeeded.
    void postFromChild(const std::vector<std::string>& names) {
        pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            SystemNotifications poster(dir_);
            int failures = 0;
            for (const std::string& name : names) failures += poster.post(name).has_value() ? 1 : 0;
            _exit(failures == 0 ? 0 : 1);
        }
        int status = 0;
        ASSERT_EQ(waitpid(child, &status, 0), child);
        ASSERT_TRUE(WIFEXITED(status));
        EXPECT_EQ(WEXITSTATUS(status), 0);
    }

    test::TempDir tmp_{"bexil-notify"};
    fs::path dir_ = tmp_ / "notify";
    EventLoop loop_{1};
    SerialQueue queue_{"observer", loop_};
};

// Guards the annotation-change notification clients wait for: posts of another process reach the observer of that
// name only, with the counter, and a cancelled observation hears nothing.
TEST_F(SystemNotificationsTest, ObserverSeesPostsOfAnotherProcessButNotOtherNamesNorWhenCancelled) {
    const std::string name = "com.quorvel.bexil.annotation-change";
    SystemNotifications observer(dir_);
    std::atomic<int> calls{0}, cancelledCalls{0};
    std::promise<uint64_t> third;
    auto token = observer.observe(
        name,
        [&](const std::string& posted, uint64_t counter) {
            EXPECT_EQ(posted, name);
            if (++calls == 3) third.set_value(counter);
        },
        queue_);
    ASSERT_TRUE(token.ok());
    auto cancelled = observer.observe(
        "b", [&](const std::string&, uint64_t) { ++cancelledCalls; }, queue_);
    ASSERT_TRUE(cancelled.ok());
    observer.cancel(*cancelled);

    postFromChild({"b", name, "c", name, name});
    auto future = third.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::seconds(5)), std::future_status::ready) << "saw " << calls << " posts";
    EXPECT_EQ(future.get(), 3u);
    EXPECT_EQ(observer.state(name), 3u);
    // Blocks of one queue run in order: once this one runs, every callback queued before it has run.
    queue_.sync([] {});
    EXPECT_EQ(calls, 3);
    EXPECT_EQ(cancelledCalls, 0);
}

// Guards the counter: concurrent posters in several processes lose no increment, and garbage in the file makes the
// next post start over instead of failing.
TEST_F(SystemNotificationsTest, CounterSurvivesConcurrentPostersAndStrayContent) {
    SystemNotifications notifications(dir_);
    test::writeText(dir_ / "n", "not a number");
    ASSERT_FALSE(notifications.post("n").has_value());
    EXPECT_EQ(notifications.state("n"), 1u);

    std::vector<pid_t> children;
    for (int c = 0; c < 4; ++c) {
        pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            SystemNotifications poster(dir_);
            for (int i = 0; i < 25; ++i)
                if (poster.post("n")) _exit(1);
            _exit(0);
        }
        children.push_back(child);
    }
    for (pid_t child : children) {
        int status = 0;
        ASSERT_EQ(waitpid(child, &status, 0), child);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    EXPECT_EQ(notifications.state("n"), 101u) << "the lock file must serialise increments";
}

// Guards the notification directory: a name cannot reach a file outside it.
TEST_F(SystemNotificationsTest, BadNamesAreRefused) {
    SystemNotifications notifications(dir_);
    for (std::string bad : {std::string(), std::string("../escape"), std::string(".hidden"), std::string("a/b"),
                            std::string(SystemNotifications::kMaxNameLength + 1, 'x')}) {
        auto error = notifications.post(bad);
        ASSERT_TRUE(error.has_value()) << bad;
        EXPECT_EQ(error->code(), 4);
        EXPECT_FALSE(notifications
                         .observe(
                             bad, [](const std::string&, uint64_t) {}, queue_)
                         .ok());
    }
    EXPECT_FALSE(fs::exists(dir_.parent_path() / "escape"));
}

}  // namespace
}  // namespace bexil
