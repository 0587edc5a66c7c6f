#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>

#include "TestSupport.h"
#include "base/Document.h"
#include "database/BXDUserPrefs.h"
#include "platform/prefs/PreferencesStore.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

Value rule(const char* key, const char* pattern) { return Value::dictionary({{key, Value::string(pattern)}}); }

class BXDUserPrefsTest : public ::testing::Test {
  protected:
    // Sets "exclusions" the way an administrator's tool does, from another process.
    void setExclusionsElsewhere(const Value& value) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            PreferencesStore writer(directory_, "host");
            _exit(writer.setValue(BXDUserPrefs::kDomain, "exclusions", value) ? 1 : 0);
        }
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }

    test::TempDir directory_{"bx-userprefs"};
};

// Guards the exclusions an administrator sets while the daemon runs: seen at the next read without a restart, and
// an unreadable file means no exclusions rather than a failure.
TEST_F(BXDUserPrefsTest, ChangesByAnotherProcessAreSeenByTheSameObjectAndAnUnreadableDomainMeansNone) {
    PreferencesStore store(directory_, "host");
    BXDUserPrefs prefs(store);
    EXPECT_TRUE(prefs.exclusions().isNull());

    Value first = Value::array({rule("RZExtensionPointIdentifier", "com.example.ads")});
    setExclusionsElsewhere(first);
    EXPECT_EQ(prefs.exclusions(), first);
    // The preference is handed over exactly as stored; what a strange shape means is the caller's call.
    setExclusionsElsewhere(Value::string("everything"));
    EXPECT_EQ(prefs.exclusions(), Value::string("everything"));
    test::writeText(store.fileForDomain(BXDUserPrefs::kDomain), "garbage that is no document at all");
    EXPECT_TRUE(prefs.exclusions().isNull());
}

// Guards against malformed exclusions: only the dictionaries of an array are rule sets.
TEST_F(BXDUserPrefsTest, RuleSetsOfAMalformedValue) {
    EXPECT_TRUE(BXDUserPrefs::exclusionRuleSets(Value::string("x")).empty());
    EXPECT_TRUE(BXDUserPrefs::exclusionRuleSets(rule("RZExtensionIdentifier", "a")).empty())
        << "a single dictionary is not an array of them";
    Value a = rule("RZExtensionIdentifier", "a");
    Value b = Value::emptyDictionary();
    Value mixed = Value::array({Value::int64(1), a, Value::string("rule"), b, Value::array({a})});
    std::vector<Value> sets = BXDUserPrefs::exclusionRuleSets(mixed);
    ASSERT_EQ(sets.size(), 2u);
    EXPECT_EQ(sets[0], a);
    EXPECT_EQ(sets[1], b);
}

}  // namespace
}  // namespace bexil
