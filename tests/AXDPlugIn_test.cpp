#include <gtest/gtest.h>

#include <filesystem>

#include "axd/AXDPlugIn.h"
#include "axd/AXDServer.h"
#include "platform/layout/Layout.h"
#include "platform/sandbox/Sandbox.h"
#include "tests/support/Bundles.h"
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
        {"stand-alone elsewhere", {{"application", Value()}}, "plug-ins outside containing apps must be in /usr"},
        {"stand-alone next to the system volume",
         {{"application", Value()}, {"path", system + "x/P.appex"}},
         "plug-ins outside containing apps must be in /usr"},
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

// ---- the pattern language

namespace {

// A plug-in with string, array, number and boolean attributes, a plain Info.plist entry, an
// entitlement, and (unless `standalone`) a containing application.
std::shared_ptr<AXDPlugIn> subject(bool standalone = false) {
    Dictionary changes{
        {"plugin", dict({{"KSExtensionAttributes", dict({{"KSExtensionVersion", "1.10"},
                                                         {"Kinds", Value(annexa::Array{Value("a"), Value("b")})},
                                                         {"Empty", Value(annexa::Array{})},
                                                         {"Count", 3},
                                                         {"Off", false},
                                                         {"Text", "no"},
                                                         {"NamedLikeAnEntitlement", true},
                                                         {"Rule", dict({{"image/*", 2}})},
                                                         {"Type", "image/png"},
                                                         {"General", "image/*"}})}})},
        {"info", dict({{"KSExtension", dict({})}, {"KFBundleIdentifier", "com.example.app.share"}, {"Plain", "x"}})},
        {"entitlements", dict({{"com.example.held", true}, {"com.example.zero", 0}})},
    };
    if (standalone) {
        changes["application"] = Value();
        changes["path"] = Value(corvane::layout::systemRoot() + "/P.appex");
    }
    return AXDPlugIn::fromRegistryRecord(record(changes));
}

}  // namespace

TEST(AXDPlugInMatching, KeysPatternsAndOperators) {
    axtest::PlatformRoot root;
    auto p = subject();
    ASSERT_TRUE(p);
    const std::string uuid = p->uuid()->string();
    std::string lowerUuid = uuid;
    for (char& c : lowerUuid) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    const struct {
        const char* key;
        Value pattern;
        bool matches;
    } cases[] = {
        // Presence tests.
        {"Text", true, true},  // any string, even one that reads as no
        {"Missing", true, false},
        {"Missing", false, true},
        {"Off", false, true},
        {"Text", false, false},
        {"Count", 1, true},  // the number 1 acts as true
        {"Count", 0, false},
        // Subjects: the identifier, the UUID's upper-case text, the containing application,
        // entitlements (never attributes), attributes before the Info.plist.
        {"KSExtensionIdentifier", "com.example.share", true},
        {"com.corvane.uuid", Value(uuid), true},
        {"com.corvane.uuid", Value(lowerUuid), false},
        {"KSExtensionContainingApp", "/Apps/Example.app", true},
        {"ENTITLEMENT:com.example.held", true, true},
        {"ENTITLEMENT:com.example.zero", true, false},
        {"ENTITLEMENT:NamedLikeAnEntitlement", true, false},
        {"Plain", "x", true},
        // Operators, by the numeric-aware comparison; operands taken as written.
        {"KSExtensionVersion", "1.10", true},
        {"KSExtensionVersion", ">1.9", true},
        {"KSExtensionVersion", "<1.9", false},
        {"KSExtensionVersion", "<=1.10", true},
        {"KSExtensionVersion", ">=1.11", false},
        {"KSExtensionVersion", "<>1.10", false},
        {"KSExtensionVersion", "=1.10", true},
        {"KSExtensionVersion", "= 1.10", false},  // the blank is part of the operand
        {"KSExtensionVersion", "1.10.0", false},  // a proper prefix orders first
        {"Text", "=<no", false},                  // equality with "<no"
        {"Text", "No", false},                    // case-sensitive
        // Arrays of patterns and array subjects.
        {"KSExtensionVersion", Value(annexa::Array{Value("x"), Value(">1.5")}), true},
        {"KSExtensionVersion", Value(annexa::Array{}), false},
        {"Kinds", "b", true},
        {"Kinds", "<>c", true},
        {"Empty", "<>c", false},
        // Numbers never match string patterns.
        {"Count", "3", false},
        // Unknown "?" operators never match.
        {"Text", "?", false},
        {"Text", "?SOMETHING:x", false},
        // Type operators.
        {"Type", "?TY-CONFORMS:image/*", true},
        {"Type", "?TY-CONFORMS:text/plain", false},
        {"General", "?TY-IS:image/gif", true},
        {"General", "?TY-IS:text/plain", false},
        // Activation rules: the plug-in's rule against the host's offer.
        {"Rule", dict({{"items", Value(annexa::Array{Value("image/png")})}}), true},
        {"Rule", dict({{"items", Value(annexa::Array{Value("text/plain")})}}), false},
        {"Missing", dict({{"items", Value(annexa::Array{Value("image/png")})}}), false},
    };
    log::CaptureSink capture;
    for (const auto& c : cases) EXPECT_EQ(p->matchKeyPattern(c.key, c.pattern), c.matches) << c.key << " " << c.pattern.description();
    EXPECT_EQ(capture.count("unrecognized match operator:"), 2u);

    // Dictionaries of tests: every one must pass; absent and empty match everything.
    EXPECT_TRUE(p->match(Value()));
    EXPECT_TRUE(p->match(dict({})));
    EXPECT_TRUE(p->match(dict({{"Text", true}, {"KSExtensionVersion", ">1"}})));
    EXPECT_FALSE(p->match(dict({{"Text", true}, {"KSExtensionVersion", "<1"}})));
    EXPECT_FALSE(p->match(Value("not a dictionary")));

    // Without a containing application the key answers false, whatever the pattern.
    auto alone = subject(true);
    ASSERT_TRUE(alone);
    EXPECT_FALSE(alone->matchKeyPattern("KSExtensionContainingApp", false));
    EXPECT_FALSE(alone->matchKeyPattern("KSExtensionContainingApp", true));
    // Without a server or an annotation, the election reads 0.
    EXPECT_TRUE(p->matchKeyPattern("KSUserElection", "0"));
}

// "KSUserElection" reads the user's election through the server, with bits 8 to 15 cleared.
TEST(AXDPlugInMatching, TheElectionIsReadThroughTheServer) {
    axtest::PlatformRoot root;
    std::string app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    axtest::makeBundle(app + "/PlugIns", "One.appex",
                       axtest::plugInInfo("com.example.one", dict({{"KSExtensionAttributes", dict({})}})), "/bin/true");
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    ASSERT_TRUE(registry);
    std::shared_ptr<vantry::Registry> shared = std::move(*registry);
    ASSERT_TRUE(shared->registerBundle(app).ok());
    auto server = annexa::AXDServer::initForService("com.test.matching", nullptr, shared);
    ASSERT_TRUE(server);
    auto one = server->findPlugInAtPath(app + "/PlugIns/One.appex");
    ASSERT_TRUE(one);
    const std::pair<int, std::vector<std::pair<const char*, bool>>> elections[] = {
        {1, {{"1", true}, {"0", false}}},
        {257, {{"1", true}, {"257", false}}},  // 257 is 1 once bits 8 to 15 are cleared
        {65537, {{"65537", true}}},            // bit 16 and up stay
        {0, {{"0", true}, {">0", false}}},
    };
    for (const auto& [election, patterns] : elections) {
        server->setAnnotationForPlugIn(dict({{"election", election}}), *one);
        for (const auto& [pattern, matches] : patterns)
            EXPECT_EQ(one->matchKeyPattern("KSUserElection", Value(pattern)), matches) << election << " " << pattern;
    }
}
