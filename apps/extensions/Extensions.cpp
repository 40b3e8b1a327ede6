#include "apps/extensions/Extensions.h"

#include <algorithm>
#include <map>
#include <set>
#include <unicode/unistr.h>

#include "Annexa/AXMessage.h"
#include "Annexa/AXPlugInCore.h"
#include "Annexa/AXProtocol.h"
#include "platform/pcx/Pcx.h"
#include "platform/rpx/Rpx.h"
#include "platform/sdk/Sdk.h"
#include "platform/vantry/Vantry.h"

namespace annexa::extensions {

using corvane::Array;
using corvane::Dictionary;
using corvane::Error;
using corvane::Result;
using corvane::Status;
using corvane::Value;

namespace {

constexpr const char* kKeyboardPoint = "com.corvane.keyboard-service";
constexpr const char* kPanelDomain = "com.corvane.annexa.extensions";

std::string text(const Value& v, const std::string& otherwise = {}) {
    const std::string* s = v.asString();
    return s && !s->empty() ? *s : otherwise;
}

// Case folded the way ICU folds it, so that the search finds "Ä" by "ä".
std::string folded(std::string_view s) {
    std::string out;
    icu::UnicodeString::fromUTF8(icu::StringPiece(s.data(), static_cast<int32_t>(s.size()))).foldCase().toUTF8String(out);
    return out;
}

// The error a reply carries, or the transport's, as a status.
Status replyStatus(const corvane::rpx::Reply& reply) { return AXDaemonClient::errorInReply(reply); }

PlugIn plugInOfForm(const Value& form) {
    PlugIn p;
    p.uuid = UUID::parse(text(form[form::kUUID])).value_or(UUID{});
    p.identifier = text(form[form::kIdentifier]);
    p.version = text(form[form::kVersion], form[form::kVersion].description());
    p.path = text(form[form::kPath]);
    const Value& bundleInfo = form[form::kBundleInfo];
    p.name = text(form[form::kDisplayName],
                  text(form[form::kShortName], text(bundleInfo["KFBundleDisplayName"], text(bundleInfo["KFBundleName"], p.identifier))));
    p.applicationName = text(form[form::kContainingName]);
    p.applicationPath = text(form[form::kContainingPath]);
    const Value& plugInDictionary = form[form::kInfo];
    const Value& attributes = plugInDictionary["KSExtensionAttributes"];
    p.point = text(plugInDictionary["KSExtensionPointIdentifier"], "(no extension point)");
    p.pointTitle = text(attributes["KSExtensionPointName"], p.point);
    p.requestsOpenAccess = attributes["RequestsOpenAccess"].isTrue();
    p.election = form[form::kAnnotations][keys::kElection].int64Value().value_or(0);
    p.entitlements = form[form::kEntitlements].isDictionary() ? form[form::kEntitlements] : Value(Dictionary{});
    if (p.applicationPath.empty() == false && p.applicationName.empty())
        p.applicationName = p.applicationPath.substr(p.applicationPath.rfind('/') + 1);
    return p;
}

std::vector<Group> grouped(std::vector<PlugIn> plugIns) {
    std::map<std::pair<std::string, std::string>, Group> byPoint;
    for (PlugIn& p : plugIns) {
        Group& g = byPoint[{folded(p.pointTitle), p.point}];
        g.title = p.pointTitle;
        g.point = p.point;
        g.plugIns.push_back(std::move(p));
    }
    std::vector<Group> groups;
    for (auto& [key, g] : byPoint) {
        std::stable_sort(g.plugIns.begin(), g.plugIns.end(), [](const PlugIn& a, const PlugIn& b) {
            return std::make_tuple(folded(a.name), a.version, a.path) < std::make_tuple(folded(b.name), b.version, b.path);
        });
        groups.push_back(std::move(g));
    }
    return groups;
}

// After `prefix`, the rest of `s`; nothing when `s` does not start so.
std::optional<std::string> after(const std::string& s, std::string_view prefix) {
    if (s.rfind(prefix, 0) != 0) return std::nullopt;
    return s.substr(prefix.size());
}

}  // namespace

const PlugIn* Snapshot::find(const UUID& uuid) const {
    for (const Group& g : groups)
        for (const PlugIn& p : g.plugIns)
            if (p.uuid == uuid) return &p;
    return nullptr;
}

bool matchesSearch(const PlugIn& plugIn, std::string_view searched) {
    std::string needle = folded(searched);
    if (needle.empty()) return true;
    for (const std::string* field : {&plugIn.name, &plugIn.identifier, &plugIn.applicationName, &plugIn.pointTitle, &plugIn.point})
        if (folded(*field).find(needle) != std::string::npos) return true;
    return false;
}

std::string wordOutcome(const std::string& outcome, const std::function<std::string(const std::string&)>& names) {
    if (outcome == "returned") return "Offered";
    if (outcome == "not on the system volume and not inside an application")
        return "Not offered: it is neither part of the system nor inside an application";
    if (outcome == "not on the system volume") return "Not offered: the host asks only for plug-ins of the system";
    if (outcome == "dedicated to another application") return "Not offered: it serves only its own application";
    if (outcome == "held") return "Not offered for now: its application is being installed or updated";
    constexpr const char* kOff = "Not offered: the host asks only for plug-ins you turned on, and this one is off";
    if (auto rule = after(outcome, "rule ")) {
        size_t colon = rule->find(" does not match: ");
        if (colon != std::string::npos && rule->substr(0, colon) == keys::kUserElection && rule->substr(colon + 17) == "\"1\"")
            return kOff;
        if (colon != std::string::npos)
            return "Not offered: the host asks for " + rule->substr(0, colon) + " to be " + rule->substr(colon + 17) +
                   ", and this plug-in's is not";
    }
    if (auto pattern = after(outcome, "excluded by the user: "))
        return "Not offered: you turned off plug-ins like this one (" + *pattern + ")";
    if (auto reason = after(outcome, "not allowed: ")) return "Not offered: the host may not use it (" + *reason + ")";
    if (auto error = after(outcome, "cannot be exported: ")) return "Not offered: it cannot be read (" + *error + ")";
    if (auto uuid = after(outcome, "collapsed in favour of "))
        return "Not offered: another registration of it is offered instead (" + names(*uuid) + ")";
    if (auto election = after(outcome, "left out by the election filter: its election reads as ")) {
        if (*election == "0") return kOff;
        return "Not offered: the host asks only for plug-ins of another choice (this one's is " + *election + ")";
    }
    return outcome;
}

std::optional<std::string> wordEntitlement(const std::string& key, const Value& value) {
    if (!entitlementGranted(value)) return std::nullopt;
    if (key == keys::kReplaceEntitlement) return "Takes the place of " + text(value, value.description());
    if (key == keys::kAutoElectEntitlement) return std::string("Turns itself on when it is installed");
    if (key == keys::kManagerEntitlement) return std::string("Sees and manages every plug-in");
    if (key == keys::kAllowedPlugInsEntitlement) return std::string("Uses only some plug-ins as a host");
    if (key == corvane::pcx::kManagerEntitlement) return std::string("Reads every application's privacy choices");
    if (key.rfind("com.corvane.private.", 0) == 0) return "Private platform entitlement " + key;
    return std::nullopt;
}

Result<Value> parseRules(std::string_view typed) {
    size_t start = typed.find_first_not_of(" \t\n");
    if (start == std::string_view::npos) return Value();
    auto json = Value::parseJson(typed);
    Result<Value> rules = json ? json : Value::parseReporting(typed);
    if (!rules) return Error(kPanelDomain, 1, "the rules are neither JSON nor the text notation: " + json.error().description());
    if (!rules->isDictionary()) return Error(kPanelDomain, 1, std::string("the rules are not a dictionary of keys and patterns"));
    return rules;
}

struct Extensions::Watch {
    std::shared_ptr<corvane::rpx::Connection> connection;
    ~Watch() {
        if (connection) connection->cancel();
    }
};

Extensions::Extensions(std::optional<std::string> serviceName) : client_(serviceName) {}

Extensions::~Extensions() = default;

Result<Snapshot> Extensions::load() {
    using namespace discovery;
    Snapshot snapshot;
    // Every registration of every plug-in, without visibility rules: a manager's view. Without the
    // entitlement axd answers 11, and the panel shows what it is offered as a host.
    uint64_t every = kAllVersions | kDuplicates;
    auto reply = client_.wait([&](auto done) { client_.matchPlugIns(Value(), every | kAll, done); });
    snapshot.fullView = true;
    if (Status status = replyStatus(reply); !status.ok() && status.error().code == errorCodeValue(AXErrorCode::NotEntitled)) {
        snapshot.fullView = false;
        reply = client_.wait([&](auto done) { client_.matchPlugIns(Value(), every, done); });
    }
    if (Status status = replyStatus(reply); !status.ok()) return status.error();
    std::vector<PlugIn> plugIns;
    if (const Array* forms = reply.value[message::kMatches].asArray())
        for (const Value& form : *forms) plugIns.push_back(plugInOfForm(form));
    // The holds: the explanation says "held" of what a hold keeps from hosts.
    auto explained = client_.wait([&](auto done) { client_.matchPlugIns(Value(), every | kExplain, done); });
    std::set<std::string> held;
    if (const Array* all = explained.value["explanations"].asArray())
        for (const Value& e : *all)
            if (e["outcome"] == Value("held")) held.insert(text(e["uuid"]));
    for (PlugIn& p : plugIns) p.held = held.count(p.uuid.string()) > 0;
    snapshot.groups = grouped(std::move(plugIns));
    return snapshot;
}

Status Extensions::setElection(const UUID& uuid, bool elected) {
    Value annotation(Dictionary{{keys::kElection, Value(int64_t{elected ? 1 : 0})}});
    auto reply = client_.wait([&](auto done) { client_.setPlugInAnnotations({uuid}, annotation, done); });
    return replyStatus(reply);
}

Result<std::vector<Explanation>> Extensions::explain(const std::string& hostPath, const Value& rules, const Snapshot& known) {
    using namespace discovery;
    Dictionary m = client_.request(request::kMatch);
    m[message::kRules] = convertValueToMessage(rules);
    m[message::kFlags] = Value(uint64_t{kExplain});
    if (!hostPath.empty()) m[message::kHost] = Value(hostPath);
    auto reply = client_.wait([&](auto done) { client_.send(Value(std::move(m)), done); });
    if (Status status = replyStatus(reply); !status.ok()) return status.error();
    auto nameOf = [&](const std::string& uuidText) {
        auto uuid = UUID::parse(uuidText);
        const PlugIn* p = uuid ? known.find(*uuid) : nullptr;
        return p ? p->name + " " + p->version : uuidText;
    };
    std::vector<Explanation> out;
    if (const Array* all = reply.value["explanations"].asArray()) {
        for (const Value& e : *all) {
            Explanation x;
            x.uuid = UUID::parse(text(e["uuid"])).value_or(UUID{});
            x.identifier = text(e["identifier"]);
            const PlugIn* p = known.find(x.uuid);
            x.name = p ? p->name : x.identifier;
            x.outcome = text(e["outcome"]);
            x.offered = x.outcome == "returned";
            x.worded = wordOutcome(x.outcome, nameOf);
            out.push_back(std::move(x));
        }
    }
    // What is offered first, then by name.
    std::stable_sort(out.begin(), out.end(), [](const Explanation& a, const Explanation& b) {
        return std::make_tuple(!a.offered, folded(a.name)) < std::make_tuple(!b.offered, folded(b.name));
    });
    return out;
}

std::vector<Application> Extensions::applications() {
    std::vector<Application> out;
    if (!registry_) {
        auto opened = corvane::vantry::Registry::openDefault();
        if (!opened) return out;
        registry_ = std::move(*opened);
    }
    for (const auto& app : registry_->installedApplications()) {
        if (app->isPlaceholder()) continue;
        std::string path = app->bundlePath();
        out.push_back({app->localizedName().value_or(path.substr(path.rfind('/') + 1)), path});
    }
    std::stable_sort(out.begin(), out.end(), [](const Application& a, const Application& b) { return folded(a.name) < folded(b.name); });
    return out;
}

Result<std::vector<ConsentService>> Extensions::consentServices(const PlugIn& plugIn, const Snapshot& snapshot) {
    std::vector<ConsentService> out;
    if (plugIn.applicationPath.empty()) return out;
    auto records = corvane::pcx::recordsForBundle(plugIn.applicationPath);
    if (!records) return records.error();
    std::map<std::string, bool> services;
    for (const auto& record : *records) services[record.service] = record.granted;
    // A keyboard of the application that asks for open access asks for the network.
    for (const Group& g : snapshot.groups)
        for (const PlugIn& p : g.plugIns)
            if (p.applicationPath == plugIn.applicationPath && p.point == kKeyboardPoint && p.requestsOpenAccess)
                services.emplace(corvane::pcx::kKeyboardNetworkService, false);
    for (const auto& [service, granted] : services) {
        std::string title = service == corvane::pcx::kKeyboardNetworkService ? "Network for its keyboard" : service;
        out.push_back({service, title, granted});
    }
    return out;
}

Status Extensions::setConsent(const std::string& applicationPath, const std::string& service, bool granted) {
    return corvane::pcx::setConsent(applicationPath, service, granted);
}

std::pair<std::string, std::string> Extensions::sandboxProfile(const PlugIn& plugIn, bool keyboardNetworkGranted) {
    auto choice = corvane::sdk::sandboxProfileFor(plugIn.point, plugIn.requestsOpenAccess && keyboardNetworkGranted);
    return {choice.profile, choice.why};
}

Status Extensions::startWatch(std::function<void(bool ended)> changed) {
    auto connection = corvane::rpx::Connection::connect(client_.serviceName(), corvane::dispatch::Queue::create("extensions_watch"));
    connection->setEventHandler([changed](const corvane::rpx::Event& event) { changed(event.isError()); });
    connection->resume();
    corvane::rpx::Reply reply = connection->sendWithReplySync(Value(client_.request(request::kWatch)));
    if (Status status = replyStatus(reply); !status.ok()) {
        connection->cancel();
        return status;
    }
    watch_ = std::make_unique<Watch>();
    watch_->connection = std::move(connection);
    return Status();
}

}  // namespace annexa::extensions
