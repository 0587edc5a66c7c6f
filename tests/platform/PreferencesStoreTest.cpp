#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/log/CaptureSink.h"
#include "platform/prefs/PreferencesStore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

constexpr const char* kDomain = "com.example.prefs";

class PreferencesStoreTest : public ::testing::Test {
  protected:
    // Runs `body` in a child process and waits for it; the child's exit status must be 0.
    template <class F>
    void inChild(F body) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) _exit(body() ? 0 : 1);
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status));
        ASSERT_EQ(WEXITSTATUS(status), 0);
    }

    fs::path file() const { return PreferencesStore(directory_, "host").fileForDomain(kDomain); }

    test::TempDir root_{"bx-prefs"};
    fs::path directory_ = root_ / "preferences";
};

// A reader that already cached the domain sees what another process wrote at its next read, without being made
// again; values of the same length written in quick succession are told apart too.
TEST_F(PreferencesStoreTest, ChangeByAnotherProcessIsSeenByTheNextRead) {
    PreferencesStore reader(directory_, "host");
    EXPECT_TRUE(reader.copyValueAfterSync(kDomain, "k").isNull());
    for (const char* text : {"aaaa", "bbbb", "cccc"}) {
        inChild([&] {
            PreferencesStore writer(directory_, "host");
            return !writer.setValue(kDomain, "k", Value::string(text));
        });
        EXPECT_EQ(reader.copyValueAfterSync(kDomain, "k"), Value::string(text));
    }
    // Removal of the whole file by another process reads as "not set".
    inChild([&] { return fs::remove(reader.fileForDomain(kDomain)); });
    EXPECT_TRUE(reader.copyValueAfterSync(kDomain, "k").isNull());
}

// Guards the file lock: writers in several processes at once lose no key.
TEST_F(PreferencesStoreTest, ConcurrentWritersInOtherProcessesLoseNoKey) {
    constexpr int kWriters = 4;
    constexpr int kWritesEach = 10;
    std::vector<pid_t> children;
    for (int w = 0; w < kWriters; ++w) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            PreferencesStore writer(directory_, "host");
            for (int i = 0; i < kWritesEach; ++i)
                if (writer.setValue(kDomain, "writer" + std::to_string(w) + "-" + std::to_string(i), Value::int64(i)))
                    _exit(1);
            _exit(0);
        }
        children.push_back(pid);
    }
    for (pid_t pid : children) {
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    auto domain = PreferencesStore(directory_, "host").readDomain(kDomain);
    ASSERT_TRUE(domain);
    EXPECT_EQ(domain->count(), size_t(kWriters * kWritesEach));
}

// A broken file is logged once per change (not on every read), reads as an empty domain, and is picked up as soon
// as it is repaired.
TEST_F(PreferencesStoreTest, MalformedFileReadsAsEmptyAndIsLoggedOncePerChange) {
    log::CaptureSink capture;
    PreferencesStore store(directory_, "host");
    test::writeText(file(), "<vrec><dict><key>k</key><string>unterminated");
    EXPECT_TRUE(store.copyValueAfterSync(kDomain, "k").isNull());
    EXPECT_TRUE(store.copyValueAfterSync(kDomain, "k").isNull());
    EXPECT_EQ(capture.count("cannot be used, reading it as empty"), 1u);

    ASSERT_FALSE(
        Document::writeFileAtomically(store.fileForDomain(kDomain), Value::dictionary({{"k", Value::boolean(true)}})));
    EXPECT_EQ(store.copyValueAfterSync(kDomain, "k"), Value::boolean(true));
}

// Guards the user's data: a file the store cannot read is never overwritten, and one over the size limit not read.
TEST_F(PreferencesStoreTest, WriterNeverReplacesAFileItCannotReadAndOversizedFilesAreRefused) {
    const std::string broken = "<vrec><dict><key>precious</key>";
    test::writeText(file(), broken);
    PreferencesStore store(directory_, "host");
    EXPECT_FALSE(store.readDomain(kDomain));
    EXPECT_TRUE(store.setValue(kDomain, "k", Value::int64(1)));
    EXPECT_EQ(test::readText(file()), broken);

    // Nor is a file larger than the limit read.
    log::CaptureSink capture;
    std::string text = "<vrec><dict><key>k</key><string>";
    text.append(PreferencesStore::kMaxPreferencesFileBytes, 'x');
    text += "</string></dict></vrec>";
    test::writeText(file(), text);
    PreferencesStore fresh(directory_, "host");
    EXPECT_TRUE(fresh.copyValueAfterSync(kDomain, "k").isNull());
    EXPECT_TRUE(capture.contains("is larger than"));
}

// Guards against a domain name that would put the file outside the preferences directory.
TEST_F(PreferencesStoreTest, DomainNamesCannotLeaveTheDirectory) {
    PreferencesStore store(directory_, "host");
    for (const char* domain : {"../escape", "", ".."}) {
        EXPECT_TRUE(store.setValue(domain, "k", Value::int64(1))) << domain;
        EXPECT_FALSE(store.readDomain(domain)) << domain;
        EXPECT_TRUE(store.copyValueAfterSync(domain, "k").isNull()) << domain;
    }
    EXPECT_FALSE(fs::exists(root_ / "escape.host.vrec"));
}

}  // namespace
}  // namespace bexil
