#include <gtest/gtest.h>

#include <filesystem>

#include "axd/AXDPlugIn.h"
#include "platform/layout/Layout.h"
#include "platform/sandbox/Sandbox.h"
#include "tests/support/TestSupport.h"

using annexa::AXDPlugIn;
using annexa::Dictionary;
using annexa::Value;
using corvane::dict;
namespace log = corvane::log;
namespace vantry = corvane::vantry;

namespace {

// A registry record as the registry would hand it out, with `changes` applied on top of a sound
// application-extension plug-in.
vantry::PlugInRecordPtr record(Dictionary changes = {}) {
    Dictionary r{
        {"uuid", corvane::UUID::random().string()},
        {"path", "/Apps/Example.app/PlugIns/Share.appex"},
        {"identifier", "com.example.share"},
        {"bundleIdentifier", "com.example.app.share"},
        {"originalIdentifier", "com.example.app.share"},
        {"version", "1"},
        {"plugin", dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", "1.0"}})}})},
        {"info", dict({{"KSExtension", dict({})}, {"KFBundleIdentifier", "com.example.app.share"}})},
        {"entitlements", dict({})},
        {"registered", Value(corvane::Date{1900000})},
        {"system", false},
        {"container", "/containers/4/com.example.share"},
        {"name", "Share"},
        {"application", dict({{"path", "/Apps/Example.app"}, {"identifier", "com.example.app"}, {"name", "Example"}})},
    };
    for (auto& [k, v] : changes) {
        if (v.isNull()) {
            r.erase(k);
        } else {
            r[k] = v;
        }
    }
    return vantry::PlugInRecord::deserialize(Value(r), nullptr);
}

}  // namespace

TEST(AXDPlugIn, BuiltFromTheRegistryRecordAndAnsweringFromIt) {
    auto p = AXDPlugIn::fromRegistryRecord(record());
    ASSERT_TRUE(p);
    EXPECT_EQ(p->identifier(), std::optional<std::string>("com.example.share"));
    EXPECT_EQ(p->originalIdentifier(), std::optional<std::string>("com.example.app.share"));
    EXPECT_EQ(p->lastModified(), 1);  // 1.9 s after 1970, truncated
    EXPECT_EQ(p->containingPath(), std::optional<std::string>("/Apps/Example.app"));
    EXPECT_EQ(p->version(), Value("1.0"));
    EXPECT_EQ(p->infoKey("KFBundleIdentifier"), Value("com.example.app.share"));
    EXPECT_EQ(p->localizedName(), std::optional<std::string>("Share"));
    EXPECT_EQ(p->localizedContainingName(), std::optional<std::string>("Example"));
    EXPECT_FALSE(p->localizedShortName());  // not cached: asked again next time
    p->setLocalizedShortName(std::string("Sh"));
    EXPECT_EQ(p->localizedShortName(), std::optional<std::string>("Sh"));
    auto exported = p->exportForm();
    ASSERT_TRUE(exported);
    Value form = *exported;
    EXPECT_EQ(form["localizedContainingDisplayName"], Value("Example"));

    struct Hub {
        Dictionary changes;
        uint32_t expected;
    };
    const Hub hubs[] = {
        {{}, 2},
        {{{"info", dict({{"Annexa", dict({})}})}}, 1},
        {{{"plugin", dict({{"KSExtensionAttributes", dict({})}, {"HubProtocolVersion", 3u}})}}, 3},
        // Present but not a number: its integer value, never the default.
        {{{"plugin", dict({{"KSExtensionAttributes", dict({})}, {"HubProtocolVersion", "3"}})}}, 3},
        {{{"plugin", dict({{"KSExtensionAttributes", dict({})}, {"HubProtocolVersion", "x"}})}}, 0},
    };
    for (const auto& h : hubs) {
        auto q = AXDPlugIn::fromRegistryRecord(record(h.changes));
        ASSERT_TRUE(q);
        EXPECT_EQ(q->hubProtocolVersion(), h.expected);
    }
    log::CaptureSink capture;
    EXPECT_FALSE(AXDPlugIn::fromRegistryRecord(record({{"identifier", ""}})));
    EXPECT_TRUE(capture.contains("missing identifier in plug-in at /Apps/Example.app/PlugIns/Share.appex"));
}

TEST(AXDPlugIn, DaemonDiagnoseRefusesWhatCannotRun) {
    axtest::PlatformRoot root;
    std::string system = corvane::layout::systemRoot();
    Value data = dict({{"KSExtensionProtocol", "#Data"}, {"KSExtensionAttributes", dict({})}});
    struct Case {
        const char* name;
        Dictionary changes;
        const char* error;  // null: accepted
    };
    const Case cases[] = {
        {"sound", {}, nullptr},
        {"data plug-in without container", {{"container", Value()}, {"plugin", data}}, nullptr},
        {"code plug-in without container", {{"container", Value()}}, "this plug-in has no sandbox data container"},
        {"stand-alone on the system volume", {{"application", Value()}, {"path", system + "/P.appex"}}, nullptr},
        {"stand-alone elsewhere", {{"application", Value()}}, "plug-ins outside containing apps must be in /System"},
        {"stand-alone next to the system volume",
         {{"application", Value()}, {"path", system + "x/P.appex"}},
         "plug-ins outside containing apps must be in /System"},
        {"base checks come first", {{"plugin", dict({{"KSExtensionAttributes", dict({})}, {"EmbeddedCode", 1}})}},
         "hybrid plug-ins are not supported on this platform"},
    };
    for (const auto& c : cases) {
        log::CaptureSink capture;
        auto p = AXDPlugIn::fromRegistryRecord(record(c.changes));
        if (!c.error) {
            EXPECT_TRUE(p) << c.name;
        } else {
            EXPECT_FALSE(p) << c.name;
            EXPECT_TRUE(capture.contains(std::string("ignoring mis-configured plug-in at ")));
            EXPECT_TRUE(capture.contains(c.error)) << c.name;
        }
    }
}

TEST(AXDPlugIn, EntitlementsAndTheAnnotationKey) {
    struct Case {
        Value value;
        bool held;
        std::string annotationKey;
    };
    const Case cases[] = {
        {Value("com.example.old"), true, "com.example.old"},
        {Value(true), true, "com.example.share"},
        {Value(false), false, "com.example.share"},
        {Value(0), false, "com.example.share"},
        {Value(Dictionary{}), true, "com.example.share"},
        {Value(), false, "com.example.share"},
    };
    for (const auto& c : cases) {
        Value ents = c.value.isNull() ? dict({}) : dict({{"com.corvane.developer.replace-plugin", c.value}});
        auto p = AXDPlugIn::fromRegistryRecord(record({{"entitlements", ents}}));
        EXPECT_EQ(p->hasEntitlement("com.corvane.developer.replace-plugin"), c.held) << c.value.description();
        EXPECT_EQ(p->annotationKey(), c.annotationKey) << c.value.description();
    }
    EXPECT_EQ(Value(AXDPlugIn::prunedInfoDictionaryFor(dict({{"DTSDKName", 1}, {"KFBundleName", 2}, {"dt", 3}}))),
              dict({{"KFBundleName", 2}, {"dt", 3}}));
}

TEST(AXDPlugIn, ResourceTokensInTheForm) {
    axtest::PlatformRoot root;
    std::string appex = root / "Example.app/PlugIns/Share.appex";
    std::string bundle = root / "Example.app/PlugIns/Tool.bundle";
    axtest::writeFile(appex + "/Resources/x", "x");
    axtest::writeFile(bundle + "/Resources/x", "x");
    Value shared = Value(annexa::Array{Value("."), Value("Resources/x"), Value(5), Value("missing")});
    auto pluginWith = [](const Value& s) {
        return dict({{"KSExtensionProtocol", "P"}, {"KSExtensionAttributes", dict({})}, {"Shared", s}});
    };

    auto ext = AXDPlugIn::fromRegistryRecord(record({{"path", appex}, {"plugin", pluginWith(shared)}}));
    Dictionary form;
    ext->augmentForm(form);
    const Dictionary* tokens = form["extensions"].asDictionary();
    ASSERT_TRUE(tokens);
    ASSERT_EQ(tokens->size(), 1u);  // an application extension offers the bundle itself only
    auto token = corvane::sandbox::parseToken(*tokens->at(".").asString());
    ASSERT_TRUE(token);
    EXPECT_EQ(token->path, std::filesystem::canonical(appex).string());
    EXPECT_TRUE(corvane::sandbox::verifyToken(*token));

    log::CaptureSink capture;
    auto tool = AXDPlugIn::fromRegistryRecord(record({{"path", bundle}, {"plugin", pluginWith(shared)}}));
    ASSERT_TRUE(tool);
    Dictionary toolForm;
    tool->augmentForm(toolForm);
    const Dictionary* toolTokens = toolForm["extensions"].asDictionary();
    ASSERT_TRUE(toolTokens);
    EXPECT_EQ(toolTokens->size(), 2u);  // ".", "Resources/x"; the number is skipped, "missing" fails
    EXPECT_TRUE(toolTokens->count("Resources/x"));
    EXPECT_TRUE(capture.contains("failed to make extension for " + bundle + "/missing in plug-in at " + bundle +
                                 ": No such file or directory"));
    EXPECT_EQ(tool->issueResourceExtensions(Value("Resources/x")).size(), 1u);

    auto none = AXDPlugIn::fromRegistryRecord(
        record({{"path", bundle}, {"plugin", dict({{"KSExtensionProtocol", "P"}, {"KSExtensionAttributes", dict({})}})}}));
    Dictionary untouched;
    none->augmentForm(untouched);
    EXPECT_TRUE(untouched.empty());
}
