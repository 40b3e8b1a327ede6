#include <gtest/gtest.h>

#include <algorithm>

#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/sdk/Sdk.h"
#include "tests/support/TestSupport.h"

namespace sdk = corvane::sdk;
using corvane::Array;
using corvane::dict;
using corvane::Value;

namespace {

bool sameElements(const Value& list, std::vector<Value> expected) {
    const Array* a = list.asArray();
    if (!a || a->size() != expected.size()) return false;
    return std::all_of(expected.begin(), expected.end(), [&](const Value& e) {
        return std::find(a->begin(), a->end(), e) != a->end();
    });
}

}  // namespace

TEST(Sdk, MergeRulesAtEveryDepth) {
    struct Case {
        const char* name;
        Value sdk, plugin, expected;
    };
    const Case cases[] = {
        {"sdk fills what the plug-in leaves out",
         dict({{"KSExtension", dict({{"KSExtensionAttributes", dict({{"a", 2}, {"b", 3}})}})}}),
         dict({{"KSExtension", dict({{"KSExtensionAttributes", dict({{"a", 1}})}})}}),
         dict({{"KSExtension", dict({{"KSExtensionAttributes", dict({{"a", 1}, {"b", 3}})}})}})},
        {"CleanTimeout: the sdk's value wins, nested too",
         dict({{"CleanTimeout", 30}, {"KSExtension", dict({{"CleanTimeout", 30}})}}),
         dict({{"CleanTimeout", 10}, {"KSExtension", dict({{"CleanTimeout", 10}})}}),
         dict({{"CleanTimeout", 30}, {"KSExtension", dict({{"CleanTimeout", 30}})}})},
        {"CleanTimeout without an sdk value stays",
         dict({{"KSExtension", dict({})}}),
         dict({{"KSExtension", dict({{"CleanTimeout", 10}})}}),
         dict({{"KSExtension", dict({{"CleanTimeout", 10}})}})},
        {"other arrays keep the plug-in's",
         dict({{"KSExtension", dict({{"List", Value(Array{Value("z")})}})}}),
         dict({{"KSExtension", dict({{"List", Value(Array{Value("x")})}})}}),
         dict({{"KSExtension", dict({{"List", Value(Array{Value("x")})}})}})},
        {"scalars keep the plug-in's",
         dict({{"KSExtensionProtocol", "SDKProto"}, {"n", 1}}),
         dict({{"KSExtensionProtocol", "Mine"}, {"n", false}}),
         dict({{"KSExtensionProtocol", "Mine"}, {"n", false}})},
        {"a dictionary against a non-dictionary keeps the plug-in's",
         dict({{"k", dict({{"x", 1}})}}), dict({{"k", "text"}}), dict({{"k", "text"}})},
        {"three levels down", dict({{"a", dict({{"b", dict({{"c", 1}, {"d", 2}})}})}}),
         dict({{"a", dict({{"b", dict({{"c", 0}})}})}}),
         dict({{"a", dict({{"b", dict({{"c", 0}, {"d", 2}})}})}})},
        {"no sdk", Value(), dict({{"a", 1}}), dict({{"a", 1}})},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(sdk::mergeDictionary(c.sdk, c.plugin), c.expected) << c.name;
    }
    // Neither argument changes (values are immutable, but make sure no alias leaks through).
    Value s = dict({{"a", 1}});
    Value p = dict({{"b", 2}});
    (void)sdk::mergeDictionary(s, p);
    EXPECT_EQ(s, dict({{"a", 1}}));
    EXPECT_EQ(p, dict({{"b", 2}}));
}

TEST(Sdk, SharedResourcesAreTheUnionAtAnyDepth) {
    Value merged = sdk::mergeDictionary(
        dict({{"KSExtension", dict({{"Shared", Value(Array{Value("y"), Value("z")})}})}}),
        dict({{"KSExtension", dict({{"Shared", Value(Array{Value("x"), Value("y")})}})}}));
    EXPECT_TRUE(sameElements(merged["KSExtension"]["Shared"], {Value("x"), Value("y"), Value("z")}))
        << merged.description();
    EXPECT_TRUE(sameElements(sdk::mergeSharedResources(Value("a"), Value(Array{Value("b")})),
                             {Value("a"), Value("b")}));
    EXPECT_TRUE(sameElements(sdk::mergeSharedResources(Value(3), Value()), {}));
    EXPECT_TRUE(sdk::sdkOverridesKey("CleanTimeout"));
    EXPECT_FALSE(sdk::sdkOverridesKey("Shared"));
}

TEST(Sdk, ResolveMergesTheRegisteredDefinitionAndCanonicalizes) {
    axtest::PlatformRoot root;
    Value definition = dict({{"KSExtension", dict({{"KSExtensionProtocol", "PickerProtocol"},
                                                   {"KSExtensionAttributes",
                                                    dict({{"KSExtensionPointName", "Picker"}})}})}});
    ASSERT_TRUE(corvane::layout::makeDirectories(sdk::sdkDirectory(), 0755).ok());
    ASSERT_TRUE(corvane::plist::writeXMLFile(sdk::sdkDirectory() + "/com.corvane.picker.plist",
                                              definition).ok());
    struct Case {
        const char* name;
        Value info;
        Value expectedPlugin;
        bool invalid;
    };
    const Case cases[] = {
        {"registered sdk, version from the short version string",
         dict({{"KFBundleShortVersionString", "2.1"},
               {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.corvane.picker"}})}}),
         dict({{"KSExtensionPointIdentifier", "com.corvane.picker"},
               {"KSExtensionProtocol", "PickerProtocol"},
               {"KSExtensionAttributes",
                dict({{"KSExtensionPointName", "Picker"}, {"KSExtensionVersion", "2.1"}})}}),
         false},
        {"unregistered sdk, no version anywhere",
         dict({{"KSExtension", dict({{"KSExtensionPointIdentifier", "com.corvane.none"}})}}),
         dict({{"KSExtensionPointIdentifier", "com.corvane.none"},
               {"KSExtensionAttributes", dict({{"KSExtensionVersion", "1"}})}}),
         false},
        {"no extension point: canonicalized without lookup",
         dict({{"KSExtension", dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", "3"}})}})}}),
         dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", "3"}})}}), false},
        {"identifier that is a number: untouched",
         dict({{"KSExtension", dict({{"KSExtensionPointIdentifier", 7}})}}),
         dict({{"KSExtensionPointIdentifier", 7}}), true},
        {"identifier naming another file is never looked up",
         dict({{"KSExtension", dict({{"KSExtensionPointIdentifier", "../sdk/com.corvane.picker"}})}}),
         dict({{"KSExtensionPointIdentifier", "../sdk/com.corvane.picker"},
               {"KSExtensionAttributes", dict({{"KSExtensionVersion", "1"}})}}),
         false},
    };
    for (const auto& c : cases) {
        auto r = sdk::resolve(c.info);
        EXPECT_EQ(r.plugin, c.expectedPlugin) << c.name << ": " << r.plugin.description();
        EXPECT_EQ(r.invalidSdkKey, c.invalid) << c.name;
    }
    // The merged Info.plist keeps its own KSExtension entry uncanonicalized.
    auto r = sdk::resolve(cases[0].info);
    EXPECT_FALSE(r.info["KSExtension"]["KSExtensionAttributes"].has("KSExtensionVersion"));
    EXPECT_EQ(r.info["KSExtension"]["KSExtensionProtocol"], Value("PickerProtocol"));
    // A definition that is no dictionary counts as none.
    axtest::writeFile(sdk::sdkDirectory() + "/com.corvane.bad.plist", "not a plist");
    EXPECT_FALSE(sdk::readDefinition("com.corvane.bad"));
    EXPECT_FALSE(sdk::readDefinition(""));
    EXPECT_TRUE(sdk::readDefinition("com.corvane.picker"));
}
