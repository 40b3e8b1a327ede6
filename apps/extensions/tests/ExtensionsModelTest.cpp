// The panel's model on its own: the wording of axd's explanations, the search, the rules a person
// types and the entitlements that concern the user. The panel against real daemons is tested in
// tests/panel.
#include <gtest/gtest.h>

#include "apps/extensions/Extensions.h"

using namespace annexa::extensions;
using corvane::Value;

TEST(ExtensionsModel, EveryOutcomeOfAnExplanationIsWordedForPeople) {
    auto names = [](const std::string& uuid) { return uuid == "AAAA" ? std::string("Mail 2") : uuid; };
    struct Case {
        std::string outcome, worded;
    };
    for (const Case& c : std::vector<Case>{
             {"returned", "Offered"},
             {"not on the system volume and not inside an application",
              "Not offered: it is neither part of the system nor inside an application"},
             {"not on the system volume", "Not offered: the host asks only for plug-ins of the system"},
             {"dedicated to another application", "Not offered: it serves only its own application"},
             {"held", "Not offered for now: its application is being installed or updated"},
             {"rule KSExtensionPointName does not match: \"Share\"",
              "Not offered: the host asks for KSExtensionPointName to be \"Share\", and this plug-in's is not"},
             {"rule KSUserElection does not match: \"1\"",
              "Not offered: the host asks only for plug-ins you turned on, and this one is off"},
             {"excluded by the user: {\"KSExtensionIdentifier\": \"x\"}",
              "Not offered: you turned off plug-ins like this one ({\"KSExtensionIdentifier\": \"x\"})"},
             {"not allowed: the host does not have the \"e\" entitlement",
              "Not offered: the host may not use it (the host does not have the \"e\" entitlement)"},
             {"cannot be exported: bad", "Not offered: it cannot be read (bad)"},
             {"collapsed in favour of AAAA", "Not offered: another registration of it is offered instead (Mail 2)"},
             {"left out by the election filter: its election reads as 0",
              "Not offered: the host asks only for plug-ins you turned on, and this one is off"},
             {"left out by the election filter: its election reads as 255",
              "Not offered: the host asks only for plug-ins of another choice (this one's is 255)"},
             // An outcome a newer axd gives is shown as it is.
             {"something new", "something new"},
         }) {
        EXPECT_EQ(wordOutcome(c.outcome, names), c.worded) << c.outcome;
    }
}

TEST(ExtensionsModel, SearchFindsNameIdentifierApplicationAndPointWithoutCase) {
    PlugIn p;
    p.name = "Äpfel Share";
    p.identifier = "com.example.apples.share";
    p.applicationName = "Orchard";
    p.point = "com.corvane.share";
    p.pointTitle = "Share";
    for (const auto& [text, found] : std::vector<std::pair<std::string, bool>>{
             {"", true}, {"äpfel", true}, {"ÄPFEL", true}, {"apples.SHARE", true}, {"orch", true},
             {"corvane.share", true}, {"pear", false}, {"Share Äpfel", false}}) {
        EXPECT_EQ(matchesSearch(p, text), found) << text;
    }
}

TEST(ExtensionsModel, TypedRulesAreJsonOrTheTextNotationAndADictionary) {
    EXPECT_TRUE(parseRules("")->isNull());
    EXPECT_TRUE(parseRules("  \n")->isNull());
    EXPECT_EQ(*parseRules("{\"KSExtensionPointName\": \"Share\"}"), Value(corvane::dict({{"KSExtensionPointName", "Share"}})));
    EXPECT_EQ(*parseRules("{\"Count\": 2u}"), Value(corvane::dict({{"Count", uint64_t{2}}})));
    for (const char* bad : {"[\"a\"]", "\"Share\"", "{\"a\": ", "KSExtensionPointName=Share"}) {
        auto rules = parseRules(bad);
        EXPECT_FALSE(rules.ok()) << bad;
    }
}

TEST(ExtensionsModel, OnlyEntitlementsThatConcernTheUserAreWorded) {
    struct Case {
        std::string key;
        Value value;
        std::optional<std::string> worded;
    };
    for (const Case& c : std::vector<Case>{
             {"com.corvane.developer.replace-plugin", Value("com.example.old"), "Takes the place of com.example.old"},
             {"com.corvane.developer.auto-elect-plugin", Value(true), "Turns itself on when it is installed"},
             {"com.corvane.developer.auto-elect-plugin", Value(false), std::nullopt},
             {"com.corvane.private.annexa.manager", Value(true), "Sees and manages every plug-in"},
             {"com.corvane.private.other", Value(true), "Private platform entitlement com.corvane.private.other"},
             {"com.example.own", Value(true), std::nullopt},
         }) {
        EXPECT_EQ(wordEntitlement(c.key, c.value), c.worded) << c.key;
    }
}
