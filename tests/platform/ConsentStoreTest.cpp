#include <gtest/gtest.h>

#include <filesystem>

#include "TestSupport.h"
#include "base/Document.h"
#include "platform/ksn/ConsentStore.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

class ConsentStoreTest : public ::testing::Test {
  protected:
    fs::path file() const { return directory_ / "state" / "consent.vrec"; }
    void put(const Value& root) {
        fs::create_directories(file().parent_path());
        ASSERT_FALSE(Document::writeFileAtomically(file(), root));
    }

    test::TempDir directory_{"bx-consent"};
};

// Guards the stored answers: no file grants nothing, answers are kept per bundle and service, a revoked answer is
// recorded as false rather than forgotten.
TEST_F(ConsentStoreTest, AnswersAreKeptPerBundleAndService) {
    ConsentStore store(file());
    EXPECT_TRUE(store.grantedServices("com.example.App").empty());
    ASSERT_FALSE(store.setGranted("com.example.App", "camera", true));
    ASSERT_FALSE(store.setGranted("com.example.App", "contacts", false));
    ASSERT_FALSE(store.setGranted("com.example.App", "addressbook", true));
    ASSERT_FALSE(store.setGranted("com.example.Other", "photos", true));
    EXPECT_EQ(store.grantedServices("com.example.App"), (std::set<std::string>{"addressbook", "camera"}));

    ASSERT_FALSE(store.setGranted("com.example.App", "camera", false));
    auto records = store.informationForBundleIdentifier("com.example.App");
    ASSERT_TRUE(records);
    EXPECT_EQ(*records, (std::vector<ConsentRecord>{{"addressbook", true}, {"camera", false}, {"contacts", false}}));
}

// A hand-edited file may hold answers that are not yes or no: such a service is known but not granted.
TEST_F(ConsentStoreTest, AnswersOfOtherKindsAreNotGrants) {
    put(Value::dictionary({{"com.example.App", Value::dictionary({{"camera", Value::string("yes")},
                                                                  {"mic", Value::int64(1)},
                                                                  {"photos", Value::boolean(true)}})}}));
    ConsentStore store(file());
    auto records = store.informationForBundleIdentifier("com.example.App");
    ASSERT_TRUE(records);
    EXPECT_EQ(*records,
              (std::vector<ConsentRecord>{{"camera", std::nullopt}, {"mic", std::nullopt}, {"photos", true}}));
    EXPECT_EQ(store.grantedServices("com.example.App"), (std::set<std::string>{"photos"}));
}

// Guards the user's answers: an unreadable file fails the query and is never overwritten by a write.
TEST_F(ConsentStoreTest, UnusableFileOrEntryFailsTheQueryAndIsNeverOverwritten) {
    log::CaptureSink capture;
    const std::string broken = "<vrec><dict><key>com.example.App</key>";
    test::writeText(file(), broken);
    ConsentStore store(file());
    EXPECT_FALSE(store.informationForBundleIdentifier("com.example.App"));
    EXPECT_TRUE(store.grantedServices("com.example.App").empty());
    EXPECT_TRUE(store.setGranted("com.example.App", "camera", true));
    EXPECT_EQ(test::readText(file()), broken);

    // An entry that is not a dictionary fails the query for that bundle only.
    put(Value::dictionary({{"com.example.App", Value::array({Value::string("camera")})}}));
    EXPECT_FALSE(store.informationForBundleIdentifier("com.example.App"));
    EXPECT_TRUE(store.setGranted("com.example.App", "camera", true));
    auto other = store.informationForBundleIdentifier("com.example.Other");
    ASSERT_TRUE(other);
    EXPECT_TRUE(other->empty());
}

}  // namespace
}  // namespace bexil
