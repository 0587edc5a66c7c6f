#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "TestSupport.h"
#include "bexil/Value.h"
#include "platform/types/ActivationRuleEvaluator.h"
#include "platform/types/TypeRegistry.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

// Each test gets its own data directories with small hand-written MIME databases.
class MimeDirFixture : public ::testing::Test {
  protected:
    fs::path dataDir(const std::string& name) {
        fs::path dir = root_ / name;
        fs::create_directories(dir / "mime");
        return dir;
    }
    static void write(const fs::path& dir, const char* file, const std::string& text) {
        test::writeText(dir / "mime" / file, text);
    }

    test::TempDir root_{"bexil-types"};
};

using TypeRegistryTest = MimeDirFixture;

// Lines that are comments, blank or have other than two fields are skipped; names compare without regard to case.
TEST_F(TypeRegistryTest, ConformanceFollowsSubclassesTransitivelyAndOnlyUpwards) {
    fs::path dir = dataDir("a");
    write(dir, "subclasses",
          "# comment line\n"
          "image/x-fancy-png Image/PNG\n"
          "image/png image/x-raster\n"
          "\n"
          "image/x-raster image/x-picture\n"
          "this line has too many fields\n");
    TypeRegistry types({dir});
    EXPECT_TRUE(types.conformsTo("image/png", "IMAGE/png"));
    EXPECT_TRUE(types.conformsTo("image/X-Fancy-PNG", "image/x-picture"));
    EXPECT_FALSE(types.conformsTo("image/x-picture", "image/png"));
    EXPECT_FALSE(types.conformsTo("image/png", "image/jpeg"));
    EXPECT_FALSE(types.conformsTo("this", "line"));
}

// Guards against a subclass cycle making the search loop for ever.
TEST_F(TypeRegistryTest, SubclassCycleEndsTheSearch) {
    fs::path cyclic = dataDir("cyclic");
    write(cyclic, "subclasses", "a/one a/two\na/two a/three\na/three a/one\n");
    TypeRegistry cycle({cyclic});
    EXPECT_TRUE(cycle.conformsTo("a/one", "a/three"));
    EXPECT_FALSE(cycle.conformsTo("a/one", "a/four"));
}

// Guards the implicit parents (text/* is text/plain, other media are binary, inode/* is neither) and that only
// "media/subtype" names get them.
TEST_F(TypeRegistryTest, ImplicitParentsApplyOnlyToMediaTypes) {
    TypeRegistry types({dataDir("empty")});
    EXPECT_TRUE(types.conformsTo("text/x-notes", "text/plain"));
    EXPECT_TRUE(types.conformsTo("image/png", "application/octet-stream"));
    EXPECT_FALSE(types.conformsTo("inode/directory", "application/octet-stream"));
    EXPECT_FALSE(types.conformsTo("image/png", "text/plain"));
    for (const char* notAType : {"a/b/c", "image/"})
        EXPECT_FALSE(types.conformsTo(notAType, "application/octet-stream")) << notAType;
    EXPECT_FALSE(types.conformsTo("", ""));
}

// Guards aliases (resolved on both sides of a question, without regard to case) and the search path: the first
// directory's alias wins, subclasses of all add up, a missing one is skipped.
TEST_F(TypeRegistryTest, EarlierDirectoriesWinAliasesAndSubclassesAddUp) {
    fs::path first = dataDir("first");
    fs::path second = dataDir("second");
    write(first, "aliases", "image/x-old image/png\n");
    write(second, "aliases", "image/x-old image/gif\n");
    write(first, "subclasses", "image/png image/x-raster\n");
    write(second, "subclasses", "image/png image/x-web\n");
    TypeRegistry types({first, root_ / "missing", second});
    EXPECT_EQ(types.canonicalType("IMAGE/X-OLD"), "image/png");
    EXPECT_TRUE(types.conformsTo("image/png", "image/x-old"));
    EXPECT_TRUE(types.conformsTo("image/x-old", "image/x-raster"));
    EXPECT_TRUE(types.conformsTo("image/x-old", "image/x-web"));
    EXPECT_FALSE(types.conformsTo("image/x-old", "image/gif"));
}

// Guards reloading: changed and newly made files are read again, but not within the recheck interval.
TEST_F(TypeRegistryTest, ChangedFilesAreReadAgainButNotWithinTheRecheckInterval) {
    fs::path dir = dataDir("a");
    write(dir, "subclasses", "image/png image/x-raster\n");
    TypeRegistry types({dir}, std::chrono::milliseconds(0));
    EXPECT_TRUE(types.conformsTo("image/png", "image/x-raster"));
    EXPECT_FALSE(types.conformsTo("image/png", "image/x-web"));

    write(dir, "aliases", "image/x-png image/png\n");  // a file that did not exist before
    write(dir, "subclasses", "image/png image/x-web\n");
    EXPECT_TRUE(types.conformsTo("image/x-png", "image/x-web"));

    // Within the recheck interval the loaded data is kept.
    fs::path kept = dataDir("b");
    write(kept, "subclasses", "image/png image/x-raster\n");
    TypeRegistry patient({kept}, std::chrono::hours(1));
    EXPECT_TRUE(patient.conformsTo("image/png", "image/x-raster"));
    write(kept, "subclasses", "image/png image/x-web\n");
    EXPECT_TRUE(patient.conformsTo("image/png", "image/x-raster"));
}

// ---- Activation rules ----

class ActivationRuleTest : public MimeDirFixture {
  protected:
    void SetUp() override {
        MimeDirFixture::SetUp();
        fs::path dir = dataDir("a");
        write(dir, "subclasses", "image/png image/x-raster\nimage/jpeg image/x-raster\n");
        types_ = std::make_unique<TypeRegistry>(std::vector<fs::path>{dir});
        evaluator_ = std::make_unique<ActivationRuleEvaluator>(*types_);
    }

    static Value rule(std::vector<std::pair<std::string, Value>> entries) {
        return Value::dictionary(std::move(entries));
    }
    static Value items(std::vector<std::string> types) {
        std::vector<Value> list;
        for (auto& type : types) list.push_back(Value::string(type));
        return Value::dictionary({{"attachments", Value::array(std::move(list))}});
    }
    bool accepts(const Value& rule, const Value& items) const {
        return evaluator_->evaluateActivationRuleWithExtensionItemsRepresentation(rule, items);
    }

    std::unique_ptr<TypeRegistry> types_;
    std::unique_ptr<ActivationRuleEvaluator> evaluator_;
};

// Guards the counting: each attachment needs a conforming type with a slot left, and the assignment must not be
// greedy: a first choice that leaves a later attachment without a slot is given up.
TEST_F(ActivationRuleTest, EachAttachmentNeedsAConformingTypeWithinItsCount) {
    Value twoImages = rule({{"image/x-raster", Value::int64(2)}});
    EXPECT_TRUE(accepts(twoImages, items({"image/png", "image/jpeg"})));
    EXPECT_FALSE(accepts(twoImages, items({"image/png", "image/jpeg", "image/png"})));
    EXPECT_FALSE(accepts(twoImages, items({"image/png", "text/plain"})));

    // The first PNG fits both types; it must give way so that the text file can use the octet-stream slot.
    Value mixed = rule({{"application/octet-stream", Value::int64(1)}, {"image/png", Value::int64(1)}});
    EXPECT_TRUE(accepts(mixed, items({"image/png", "text/plain"})));
    EXPECT_FALSE(accepts(mixed, items({"image/png", "text/plain", "image/png"})));
}

// Guards malformed rules and items (refused, never taken as "anything goes") and the attachment limit at its edge.
TEST_F(ActivationRuleTest, ValuesOfTheWrongKindAreRefused) {
    Value good = rule({{"image/png", Value::int64(1)}});
    EXPECT_FALSE(accepts(Value::string("image/png"), items({"image/png"})));
    EXPECT_FALSE(accepts(good, Value::dictionary({{"attachments", Value::string("image/png")}})));
    // Counts that are not whole non-negative numbers admit nothing.
    EXPECT_FALSE(accepts(rule({{"image/png", Value::int64(-1)}}), items({"image/png"})));
    EXPECT_FALSE(accepts(rule({{"image/png", Value::real(1.5)}}), items({"image/png"})));
    EXPECT_TRUE(accepts(rule({{"image/png", Value::boolean(true)}}), items({"image/png"})));

    Value unlimited = rule({{"image/png", Value::uint64(UINT64_MAX)}});
    std::vector<std::string> many(ActivationRuleEvaluator::kMaxAttachments, "image/png");
    EXPECT_TRUE(accepts(unlimited, items(many)));
    many.push_back("image/png");
    EXPECT_FALSE(accepts(unlimited, items(many)));
}

}  // namespace
}  // namespace bexil
