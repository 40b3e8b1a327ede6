#include <gtest/gtest.h>

#include "Annexa/AXPlugInCore.h"
#include "tests/support/TestSupport.h"

using annexa::AXPlugInCore;
using annexa::Dictionary;
using annexa::UUID;
using annexa::Value;
using corvane::dict;
namespace log = corvane::log;

namespace {

Value appexInfo() {
    return dict({{"KFBundleIdentifier", "com.example.app.share"},
                 {"KFBundleShortVersionString", "2.1"},
                 {"KFBundleInfoPlistURL", "file:///x/Info.plist"},
                 {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.corvane.share"},
                                       {"KSExtensionAttributes", dict({{"KSExtensionVersion", "2.1"}})},
                                       {"Shared", Value(corvane::Array{Value("res")})}})}});
}

std::shared_ptr<AXPlugInCore> fullRecord() {
    auto r = AXPlugInCore::fromSetup({.name = "com.example.app.share", .url = "/Apps/Example.app/PlugIns/Share.appex", .bundleInfo = appexInfo(), .uuid = UUID::random()});
    r->setOriginalIdentifier(std::string("com.example.app.share.original"));
    r->setContainingUrl(std::string("/Apps/Example.app"));
    r->setEntitlements(dict({{"com.corvane.developer.replace-plugin", "com.example.old"}}));
    r->setHubProtocolVersion(2);
    r->setLocalizedName(std::string("Share"));
    r->setLocalizedShortName(std::string("Sh"));
    r->setLocalizedContainingName(std::string("Example"));
    r->setAnnotations(dict({{"election", 1}, {"extension", dict({{"k", "v"}})}}));
    r->setLastModified(1795341600);
    r->setOnSystemVolume(true);
    return r;
}

// A record whose lookups come from elsewhere, as the daemon's do.
class Overriding : public AXPlugInCore {
public:
    Value plugin;
    Value sdk;
    Value pluginKey(std::string_view key) const override { return plugin[key]; }
    Value infoKey(std::string_view key) const override {
        return key == "KFBundleShortVersionString" ? Value("9.9") : Value();
    }
    Value readSDKDictionary(const std::string&) const override { return sdk; }
};

}  // namespace

TEST(AXPlugInCore, ExportThenRebuildGivesAnEqualRecord) {
    auto r = fullRecord();
    auto exported = r->exportForm();
    ASSERT_TRUE(exported) << exported.error().description();
    Value f = *exported;
    EXPECT_FALSE(f["bundleInfo"].has("KFBundleInfoPlistURL"));
    EXPECT_EQ(f["version"], Value("2.1"));
    EXPECT_EQ(f["uuid"], Value(r->uuid()->string()));
    EXPECT_EQ(f["hubProtocolVersion"].kind(), Value::Kind::UInt64);

    auto back = AXPlugInCore::initWithForm(f);
    ASSERT_TRUE(back);
    EXPECT_TRUE(*back == *r);
    EXPECT_EQ(back->hash(), r->hash());
    EXPECT_EQ(back->identifier(), r->identifier());
    EXPECT_EQ(back->originalIdentifier(), r->originalIdentifier());
    EXPECT_EQ(back->path(), r->path());
    EXPECT_EQ(back->containingPath(), r->containingPath());
    EXPECT_EQ(back->entitlements(), r->entitlements());
    EXPECT_EQ(back->hubProtocolVersion(), 2u);
    EXPECT_EQ(back->localizedName(), r->localizedName());
    EXPECT_EQ(back->localizedShortName(), r->localizedShortName());
    EXPECT_EQ(back->localizedContainingName(), r->localizedContainingName());
    EXPECT_EQ(back->annotations(), r->annotations());
    EXPECT_EQ(back->lastModified(), r->lastModified());
    EXPECT_EQ(back->onSystemVolume(), true);
    EXPECT_EQ(back->plugInDictionary(), r->bundleInfoDictionary()["KSExtension"]);
    EXPECT_EQ(back->version(), Value("2.1"));
    // The rebuilt record exports the same form.
    EXPECT_EQ(*back->exportForm(), f);
}

TEST(AXPlugInCore, FormReaderDefaultsAndOddValues) {
    auto r = AXPlugInCore::fromSetup({.name = "p", .url = "/System/P.appex", .bundleInfo = appexInfo()});
    r->setOriginalIdentifier(std::string("p"));
    auto exported = r->exportForm();
    ASSERT_TRUE(exported);
    Value f = *exported;
    EXPECT_EQ(f["annotations"], dict({}));
    EXPECT_FALSE(f.has("containingPath"));
    EXPECT_FALSE(f.has("entitlements"));
    EXPECT_FALSE(f.has("localizedDisplayName"));

    auto rebuilt = [&](std::function<void(Dictionary&)> change) {
        Dictionary d = *f.asDictionary();
        change(d);
        return AXPlugInCore::initWithForm(Value(d));
    };
    auto back = rebuilt([](Dictionary&) {});
    EXPECT_EQ(back->annotations(), dict({}));
    EXPECT_FALSE(back->containingUrl());
    EXPECT_EQ(rebuilt([](Dictionary& d) { d["hubProtocolVersion"] = Value(0u); })->hubProtocolVersion(), 0u);
    EXPECT_EQ(rebuilt([](Dictionary& d) { d.erase("hubProtocolVersion"); })->hubProtocolVersion(), 1u);
    auto fresh = rebuilt([](Dictionary& d) { d["uuid"] = Value("not a uuid"); });
    ASSERT_TRUE(fresh);
    EXPECT_FALSE(*fresh == *r);
    EXPECT_TRUE(rebuilt([](Dictionary& d) { d.erase("annotations"); })->annotations().isNull());
    // Values of the wrong type count as absent.
    EXPECT_FALSE(rebuilt([](Dictionary& d) { d["identifier"] = Value(5); }));
    EXPECT_FALSE(rebuilt([](Dictionary& d) { d.erase("path"); }));
    EXPECT_FALSE(rebuilt([](Dictionary& d) { d["bundleInfo"] = dict({{"KSExtension", "no"}}); }));
    EXPECT_EQ(rebuilt([](Dictionary& d) { d["lastmodified"] = Value("x"); })->lastModified(), 0);
    // updateFromForm touches only the annotations.
    back->updateFromForm(dict({{"annotations", dict({{"election", 2}})}, {"identifier", "other"}}));
    EXPECT_EQ(back->annotations(), dict({{"election", 2}}));
    EXPECT_EQ(back->identifier(), std::optional<std::string>("p"));
    back->updateFromForm(dict({}));
    EXPECT_TRUE(back->annotations().isNull());
}

TEST(AXPlugInCore, ExportNeedsEveryAlwaysPresentValue) {
    auto r = fullRecord();
    r->setOriginalIdentifier(std::nullopt);
    auto refused = r->exportForm();
    ASSERT_FALSE(refused);
    EXPECT_EQ(refused.error().code, 12);
    EXPECT_EQ(refused.error().text, "cannot export plug-in: missing original identifier");
    auto bare = AXPlugInCore::fromSetup({.name = "p", .url = "/p", .info = dict({})});
    bare->setOriginalIdentifier(std::string("p"));
    auto noMetadata = bare->exportForm();
    ASSERT_FALSE(noMetadata);
    EXPECT_EQ(noMetadata.error().text, "cannot export plug-in: missing bundle metadata");
    // Present values of an unexpected type are exported as they are: a numeric version too.
    auto numeric = fullRecord();
    Value current = numeric->plugInDictionary();
    Dictionary plugin = *current.asDictionary();
    plugin["KSExtensionAttributes"] = dict({{"KSExtensionVersion", 7}});
    numeric->setPlugInDictionary(Value(plugin));
    auto exported = numeric->exportForm();
    ASSERT_TRUE(exported) << exported.error().description();
    EXPECT_EQ((*exported)["version"], Value(7));
}

TEST(AXPlugInCore, DiagnoseReportsTheFirstProblemInOrder) {
    struct Case {
        const char* path;
        Value plugin;
        const char* expected;  // null: sound
    };
    const Case cases[] = {
        {"/a/P.appex", dict({{"KSExtensionAttributes", dict({})}}), nullptr},
        {"/a/P.bundle", dict({{"KSExtensionAttributes", dict({})}}),
         "missing \"KSExtensionProtocol\" key in Info.plist or SDK"},
        {"/a/P.bundle", dict({{"KSExtensionProtocol", "X"}}),
         "missing \"KSExtensionAttributes\" key in Info.plist or SDK"},
        {"/a/P.appex", dict({{"KSExtensionAttributes", dict({})}, {"PrincipalClass", "Mine"}}),
         "Application Extensions may not use the \"PrincipalClass\" key"},
        {"/a/P.appex", dict({{"KSExtensionAttributes", dict({})}, {"PassProxy", true}, {"EmbeddedCode", 1}}),
         "the \"PassProxy\" key is not supported on this platform"},
        {"/a/P.appex", dict({{"KSExtensionAttributes", dict({})}, {"EmbeddedCode", "x"}}),
         "hybrid plug-ins are not supported on this platform"},
        {"/a/P.bundle", dict({{"KSExtensionAttributes", dict({})}, {"KSExtensionProtocol", "#Data"}}), nullptr},
    };
    for (const auto& c : cases) {
        auto r = AXPlugInCore::fromSetup({.name = "p", .url = std::string(c.path), .bundleInfo = dict({{"KSExtension", c.plugin}})});
        ASSERT_TRUE(r);
        corvane::Status usable = r->diagnose();
        if (!c.expected) {
            EXPECT_TRUE(usable.ok()) << c.path << " " << c.plugin.description() << ": "
                                     << usable.error().description();
        } else {
            ASSERT_FALSE(usable.ok()) << c.expected;
            EXPECT_EQ(usable.error().code, 12);
            EXPECT_EQ(usable.error().text, std::string(c.expected));
        }
    }
    AXPlugInCore empty;
    EXPECT_EQ(empty.diagnose().error().text,
              "missing identifier (no KSExtensionIdentifier, nor even KFBundleIdentifier)");
}

TEST(AXPlugInCore, DerivedProperties) {
    auto make = [](const char* path, Value plugin) {
        return AXPlugInCore::fromSetup({.name = "p", .url = std::string(path), .bundleInfo = dict({{"KSExtension", plugin}})});
    };
    auto appex = make("/a/P.appex", dict({}));
    EXPECT_TRUE(appex->isAppExtension());
    EXPECT_EQ(appex->protocolSpec(), Value("KSObject"));
    EXPECT_EQ(appex->principalSpec(), Value("KSObject"));
    EXPECT_EQ(appex->embeddedProtocolSpec(), Value("KSObject"));
    auto other = make("/a/P.appexx", dict({{"EmbeddedProtocol", "E"}}));
    EXPECT_TRUE(other->protocolSpec().isNull());
    EXPECT_EQ(other->embeddedProtocolSpec(), Value("E"));
    for (auto [dedicated, expected] : std::vector<std::pair<Value, bool>>{
             {Value(true), true}, {Value(2), true}, {Value(0), false}, {Value(), false}, {Value("yes"), false}}) {
        Value plugin = dedicated.isNull() ? dict({}) : dict({{"Dedicated", dedicated}});
        EXPECT_EQ(make("/a/P.appex", plugin)->isDedicated(), expected) << dedicated.description();
    }
    EXPECT_TRUE(make("/a/P.appex", dict({{"KSExtensionProtocol", "#Data"}}))->isData());
    EXPECT_FALSE(appex->oldStyle());
    appex->setLastModified(2);
    EXPECT_EQ(appex->timestamp().micros, 2000000);
    EXPECT_TRUE(appex->augmentInterface(Value("x")).isNull());
}

TEST(AXPlugInCore, SetupRulesAndTheirLogLines) {
    log::CaptureSink capture;
    EXPECT_FALSE(AXPlugInCore::fromSetup({.name = "p"}));
    EXPECT_TRUE(capture.records().empty());  // no url: no message
    EXPECT_FALSE(AXPlugInCore::fromSetup({.url = "/x"}));
    EXPECT_TRUE(capture.contains("missing identifier in plug-in at /x"));
    for (const Value& bad : {dict({{"KSExtension", "string"}}), dict({}), Value("not a dictionary")}) {
        capture.clear();
        EXPECT_FALSE(AXPlugInCore::fromSetup({.name = "p", .url = "/x", .bundleInfo = bad}));
        EXPECT_TRUE(capture.contains("malformed plug-in dictionary in plug-in p at /x: ")) << bad.description();
    }
    capture.clear();
    auto multi = AXPlugInCore::fromSetup({.name = "p", .url = "/x", .bundleInfo = dict({{"KSExtension", dict({{"Multiple", true}})}})});
    ASSERT_TRUE(multi);
    EXPECT_EQ(capture.count("multiplexed plug-ins (Multiple key) obsolete and ignored"), 1u);

    // Without bundle metadata, `info` becomes the plug-in dictionary; set-up alone does not.
    Value info = dict({{"KSExtensionProtocol", "X"}});
    auto noMetadata = AXPlugInCore::fromSetup({.name = "p", .url = "/x", .info = info});
    ASSERT_TRUE(noMetadata);
    EXPECT_EQ(noMetadata->plugInDictionary(), info);
    EXPECT_TRUE(noMetadata->infoKey("KSExtension").isNull());
    AXPlugInCore plain;
    EXPECT_TRUE(plain.setup({.name = "p", .url = "/x", .info = info}));
    EXPECT_TRUE(plain.plugInDictionary().isNull());
    // Fresh UUIDs differ; a given one is kept.
    auto a = AXPlugInCore::fromSetup({.name = "p", .url = "/x", .info = info});
    EXPECT_FALSE(*a == *noMetadata);
}

TEST(AXPlugInCore, IdentityAndAnnotations) {
    UUID u = UUID::random();
    auto a = AXPlugInCore::fromSetup({.name = "a", .url = "/a", .info = dict({}), .uuid = u});
    auto b = AXPlugInCore::fromSetup({.name = "b", .url = "/b", .bundleInfo = dict({{"KSExtension", dict({})}}), .uuid = u});
    EXPECT_TRUE(*a == *b);
    EXPECT_EQ(a->hash(), b->hash());
    a->setAnnotationValue("election", 1);
    EXPECT_TRUE(a->annotations().isNull());  // absent stays absent
    a->setAnnotations(dict({{"election", 0}, {"extension", dict({})}}));
    Value before = a->annotations();
    a->setAnnotationValue("election", 1);
    a->setAnnotationValue("extension", Value());
    EXPECT_EQ(a->annotations(), dict({{"election", 1}}));
    EXPECT_EQ(before, dict({{"election", 0}, {"extension", dict({})}}));  // readers keep their copy
}

TEST(AXPlugInCore, SdkResolutionFollowsTheLookupsAndTheRecordsSource) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    auto r = AXPlugInCore::fromSetup({.name = "p", .url = "/x/P.appex", .bundleInfo = dict({{"KFBundleShortVersionString", "3"}, {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.corvane.unregistered"}})}})});
    r->resolveSDK();
    EXPECT_TRUE(capture.contains("plug-in sdk \"com.corvane.unregistered\" not registered"));
    EXPECT_EQ(r->version(), Value("3"));

    Overriding o;
    o.plugin = dict({{"KSExtensionPointIdentifier", "com.corvane.x"}, {"KSExtensionProtocol", "P"},
                     {"KSExtensionAttributes", dict({})}});
    o.sdk = dict({{"KSExtension", dict({{"KSExtensionAttributes", dict({{"KSExtensionPointName", "X"}})}})}});
    ASSERT_TRUE(o.setup({.name = "o", .url = "/x/O.appex", .bundleInfo = dict({{"KSExtension", dict({})}})}));
    EXPECT_EQ(o.protocolSpec(), Value("P"));  // derived properties follow the override
    EXPECT_TRUE(o.diagnose().ok());
    o.resolveSDK();
    // The merge went into the stored metadata; canonical form used the overriding lookups.
    EXPECT_EQ(o.bundleInfoDictionary()["KSExtension"]["KSExtensionAttributes"]["KSExtensionPointName"],
              Value("X"));
    EXPECT_EQ(o.plugInDictionary()["KSExtensionAttributes"]["KSExtensionVersion"], Value("9.9"));

    capture.clear();
    auto invalid = AXPlugInCore::fromSetup({.name = "p", .url = "/x/P.appex", .bundleInfo = dict({{"KSExtension", dict({{"KSExtensionPointIdentifier", 7}})}})});
    invalid->resolveSDK();
    EXPECT_TRUE(capture.contains("invalid SDK key:7"));
    EXPECT_FALSE(invalid->plugInDictionary().has("KSExtensionAttributes"));
}

TEST(AXPlugInCoreDeathTest, BrokenPreconditionsAbort) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(AXPlugInCore().resolveSDK(), "cannot resolve SDK without materialized Info.plist");
    EXPECT_DEATH(
        {
            auto r = AXPlugInCore::fromSetup({.name = "p", .url = "/x", .info = dict({})});
            (void)r->oldStyle();
        },
        "unknown plug-in configuration style");
    EXPECT_DEATH((void)(AXPlugInCore() == AXPlugInCore()), "self.uuid");
}
