#include <gtest/gtest.h>

#include <cstdio>
#include <string>

#include "platform/types/Types.h"
#include "tests/support/TestSupport.h"

namespace types = corvane::types;
using corvane::Array;
using corvane::dict;
using corvane::Value;

namespace {

// A small database of our own: aliases, a chain, a cycle and a text subclass.
std::shared_ptr<const types::TypeDatabase> sample(const axtest::TempDir& dir) {
    axtest::writeFile(dir / "aliases", "image/x-png image/png\napplication/x-alias application/chained\n");
    axtest::writeFile(dir / "subclasses",
                      "application/chained application/middle\n"
                      "application/middle application/base\n"
                      "application/loop-a application/loop-b\n"
                      "application/loop-b application/loop-a\n"
                      "application/x-script text/x-source\n"
                      "text/x-source text/plain\n");
    return types::TypeDatabase::read(dir.path());
}

}  // namespace

TEST(Types, ConformanceFollowsAliasesSubclassesAndTheBuiltInRules) {
    axtest::TempDir dir;
    auto db = sample(dir);
    const struct {
        const char* type;
        const char* to;
        bool conforms;
    } cases[] = {
        {"image/png", "image/png", true},
        {"IMAGE/PNG", "image/png", true},  // names compare without case
        {"image/x-png", "image/png", true},
        {"image/png", "image/x-png", true},
        {"image/png", "image/jpeg", false},
        {"application/chained", "application/base", true},  // two steps up
        {"application/x-alias", "application/base", true},   // an alias, then the chain
        {"application/base", "application/chained", false},  // never down
        {"application/loop-a", "application/loop-b", true},
        {"application/loop-a", "application/other", false},  // a cycle ends the search
        {"text/html", "text/plain", true},
        {"application/x-script", "text/plain", true},
        {"image/png", "text/plain", false},
        {"image/png", "application/octet-stream", true},
        {"inode/directory", "application/octet-stream", false},
        {"image/png", "image/*", true},
        {"text/png", "image/*", false},
        {"", "image/png", false},
        {"image/png", "", false},
    };
    for (const auto& c : cases) EXPECT_EQ(db->conformsTo(c.type, c.to), c.conforms) << c.type << " -> " << c.to;
}

TEST(Types, ActivationRulesCountTheItemsOfEachType) {
    axtest::TempDir dir;
    auto db = sample(dir);
    auto offer = [](std::initializer_list<const char*> items) {
        Array list;
        for (const char* i : items) list.push_back(Value(i));
        return dict({{"items", Value(list)}});
    };
    Value images2 = dict({{"image/*", 2}});
    Value pngOrText = dict({{"image/png", 1}, {"text/plain", 3}});
    const struct {
        const char* name;
        Value rule;
        Value offer;
        bool matches;
    } cases[] = {
        {"true takes anything", Value(true), offer({"video/mp4"}), true},
        {"false takes nothing", Value(false), offer({"image/png"}), false},
        {"within the count", images2, offer({"image/png", "image/jpeg"}), true},
        {"past the count", images2, offer({"image/png", "image/png", "image/gif"}), false},
        {"an item of no key", images2, offer({"image/png", "text/plain"}), false},
        {"each key counted", pngOrText, offer({"image/x-png", "text/html", "text/plain"}), true},
        {"one key over", pngOrText, offer({"image/png", "image/png"}), false},
        {"no items", images2, offer({}), false},
        {"no offer", images2, Value(), false},
        {"items not types", images2, dict({{"items", Value(Array{Value(1)})}}), false},
        {"a count that is no count", dict({{"image/*", "2"}}), offer({"image/png"}), false},
        {"a negative count", dict({{"image/*", -1}}), offer({"image/png"}), false},
        {"an empty rule", dict({}), offer({"image/png"}), false},
        {"a rule of another kind", Value(3), offer({"image/png"}), false},
        {"a zero count", dict({{"image/*", 0}, {"text/plain", 1}}), offer({"text/plain"}), true},
    };
    for (const auto& c : cases)
        EXPECT_EQ(types::activationRuleMatches(*db, c.rule, c.offer), c.matches) << c.name;
}

// The process's database comes from the platform root and follows changes to its files.
TEST(Types, TheProcessDatabaseFollowsItsFiles) {
    axtest::PlatformRoot root;
    std::string mime = root / "usr/share/mime";
    axtest::writeFile(mime + "/subclasses", "application/x-new application/x-old\n");
    axtest::writeFile(mime + "/aliases", "");
    EXPECT_EQ(types::mimeDirectory(), mime);
    EXPECT_TRUE(types::typeConformsTo("application/x-new", "application/x-old"));
    EXPECT_FALSE(types::typeConformsTo("application/x-newer", "application/x-old"));
    // Written as update-mime-database writes: a new file renamed into place.
    axtest::writeFile(mime + "/subclasses.new", "application/x-newer application/x-old\n");
    ASSERT_EQ(std::rename((mime + "/subclasses.new").c_str(), (mime + "/subclasses").c_str()), 0);
    EXPECT_TRUE(axtest::eventually([] { return types::typeConformsTo("application/x-newer", "application/x-old"); }));
    EXPECT_FALSE(types::typeConformsTo("application/x-new", "application/x-old"));
}
