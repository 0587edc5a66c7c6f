#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "base/Document.h"
#include "platform/ksn/ConsentStore.h"
#include "platform/log/CaptureSink.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

// A bundle whose information dictionary is given by the test.
class FakeBundle : public PlatformBundle {
  public:
    explicit FakeBundle(std::optional<Value> info) : info_(std::move(info)) {}
    std::optional<std::string> stringProperty(BundleStringProperty) const override { return std::nullopt; }
    std::optional<Value> infoDictionary() const override { return info_; }
    std::string description() const override { return "<fake bundle>"; }

  private:
    std::optional<Value> info_;
};

class ConsentStoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        std::string pattern = (fs::temp_directory_path() / "bx-consent-XXXXXX").string();
        ASSERT_NE(mkdtemp(pattern.data()), nullptr);
        directory_ = pattern;
    }
    void TearDown() override { fs::remove_all(directory_); }

    fs::path file() const { return directory_ / "state" / "consent.vrec"; }

    fs::path directory_;
};

TEST_F(ConsentStoreTest, DefaultFileIsInTheStateDirectory) {
    const char* saved = getenv("BX_STATE_DIR");
    std::string savedText = saved ? saved : "";
    setenv("BX_STATE_DIR", "/srv/bexil-state", 1);
    EXPECT_EQ(ConsentStore::defaultFile(), fs::path("/srv/bexil-state/consent.vrec"));
    if (saved)
        setenv("BX_STATE_DIR", savedText.c_str(), 1);
    else
        unsetenv("BX_STATE_DIR");
}

TEST_F(ConsentStoreTest, NoFileMeansNothingGrantedButTheQuerySucceeds) {
    ConsentStore store(file());
    auto records = store.informationForBundleIdentifier("com.example.App");
    ASSERT_TRUE(records);
    EXPECT_TRUE(records->empty());
    EXPECT_TRUE(store.grantedServices("com.example.App").empty());
}

TEST_F(ConsentStoreTest, AnswersAreKeptPerBundleAndService) {
    ConsentStore store(file());
    ASSERT_FALSE(store.setGranted("com.example.App", "camera", true));
    ASSERT_FALSE(store.setGranted("com.example.App", "contacts", false));
    ASSERT_FALSE(store.setGranted("com.example.App", "addressbook", true));
    ASSERT_FALSE(store.setGranted("com.example.Other", "photos", true));
    EXPECT_EQ(store.grantedServices("com.example.App"), (std::set<std::string>{"addressbook", "camera"}));
    EXPECT_EQ(store.grantedServices("com.example.Other"), (std::set<std::string>{"photos"}));

    // A revoked answer is recorded as false, not forgotten.
    ASSERT_FALSE(store.setGranted("com.example.App", "camera", false));
    auto records = store.informationForBundleIdentifier("com.example.App");
    ASSERT_TRUE(records);
    EXPECT_EQ(*records, (std::vector<ConsentRecord>{{"addressbook", true}, {"camera", false}, {"contacts", false}}));
}

// A hand-edited file may hold answers that are not yes or no: such a service is known but not granted.
TEST_F(ConsentStoreTest, AnswersOfOtherKindsAreNotGrants) {
    fs::create_directories(file().parent_path());
    ASSERT_FALSE(Document::writeFileAtomically(
        file(), Value::dictionary({{"com.example.App", Value::dictionary({{"camera", Value::string("yes")},
                                                                          {"mic", Value::int64(1)},
                                                                          {"photos", Value::boolean(true)}})}})));
    ConsentStore store(file());
    auto records = store.informationForBundleIdentifier("com.example.App");
    ASSERT_TRUE(records);
    EXPECT_EQ(*records,
              (std::vector<ConsentRecord>{{"camera", std::nullopt}, {"mic", std::nullopt}, {"photos", true}}));
    EXPECT_EQ(store.grantedServices("com.example.App"), (std::set<std::string>{"photos"}));
}

TEST_F(ConsentStoreTest, UnusableFileFailsTheQueryAndIsNeverOverwritten) {
    log::CaptureSink capture;
    fs::create_directories(file().parent_path());
    const std::string broken = "<vrec><dict><key>com.example.App</key>";
    std::ofstream(file()) << broken;
    ConsentStore store(file());
    EXPECT_FALSE(store.informationForBundleIdentifier("com.example.App"));
    EXPECT_TRUE(capture.contains("cannot be read"));
    EXPECT_TRUE(store.grantedServices("com.example.App").empty());
    EXPECT_TRUE(store.setGranted("com.example.App", "camera", true));
    std::stringstream text;
    text << std::ifstream(file()).rdbuf();
    EXPECT_EQ(text.str(), broken);
}

TEST_F(ConsentStoreTest, EntryThatIsNotADictionaryFailsTheQuery) {
    fs::create_directories(file().parent_path());
    ASSERT_FALSE(Document::writeFileAtomically(
        file(), Value::dictionary({{"com.example.App", Value::array({Value::string("camera")})}})));
    ConsentStore store(file());
    EXPECT_FALSE(store.informationForBundleIdentifier("com.example.App"));
    EXPECT_TRUE(store.setGranted("com.example.App", "camera", true));
    auto other = store.informationForBundleIdentifier("com.example.Other");
    ASSERT_TRUE(other);
    EXPECT_TRUE(other->empty());
}

TEST_F(ConsentStoreTest, BundleQueryGoesByItsIdentifier) {
    ConsentStore store(file());
    ASSERT_FALSE(store.setGranted("com.example.App", "camera", true));
    FakeBundle app(Value::dictionary({{"BDBundleIdentifier", Value::string("com.example.App")}}));
    auto records = store.copyInformationForBundle(app);
    ASSERT_TRUE(records);
    EXPECT_EQ(*records, (std::vector<ConsentRecord>{{"camera", true}}));

    EXPECT_FALSE(store.copyInformationForBundle(FakeBundle(std::nullopt)));
    EXPECT_FALSE(store.copyInformationForBundle(FakeBundle(Value::emptyDictionary())));
    EXPECT_FALSE(store.copyInformationForBundle(FakeBundle(Value::string("not a dictionary"))));
    EXPECT_FALSE(
        store.copyInformationForBundle(FakeBundle(Value::dictionary({{"BDBundleIdentifier", Value::int64(3)}}))));
}

}  // namespace
}  // namespace bexil
