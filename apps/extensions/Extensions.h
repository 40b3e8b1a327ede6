// What the Extensions panel shows and changes, without any of its widgets: the user's plug-ins
// grouped by extension point, their elections, holds and details, the privacy-consent services of
// their applications, and axd's explanation of why a host is not offered a plug-in, worded for
// people. Everything comes from axd ("match", "annotate", "watch") and from the user's own consent
// records; the panel sees every plug-in only when its signature carries the manager entitlement.
//
// Thread-safety: an Extensions object is used from one thread (the panel's main loop); only the
// watch's callback runs on a queue of its own.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "platform/value/Value.h"
#include "platform/vantry/Vantry.h"

namespace annexa::extensions {

struct PlugIn {
    UUID uuid;
    std::string identifier, name, version, path;
    std::string point, pointTitle;  // the extension point's identifier and its name for people
    std::string applicationName, applicationPath;  // empty for a stand-alone plug-in
    int64_t election = 0;  // the stored election, 0 without one
    bool held = false;     // an installer holds it while its application changes
    bool requestsOpenAccess = false;
    corvane::Value entitlements;  // a dictionary
    bool elected() const { return (election & 0xff) == 1; }
};

struct Group {
    std::string title, point;
    std::vector<PlugIn> plugIns;  // by name
};

struct Snapshot {
    // False when the panel lacks the manager entitlement: it shows what axd offers it as a host.
    bool fullView = false;
    std::vector<Group> groups;  // by title
    const PlugIn* find(const UUID& uuid) const;
};

// A privacy-consent service of an application, as its switch shows it.
struct ConsentService {
    std::string service, title;
    bool granted = false;
};

// One plug-in of axd's explanation.
struct Explanation {
    UUID uuid;
    std::string name, identifier, outcome, worded;
    bool offered = false;
};

// A registered application a host may be, for "Why is it not offered?".
struct Application {
    std::string name, path;
};

// Whether the plug-in's name, identifier, application or extension point contains `text`, without
// regard to case; every plug-in contains the empty text.
bool matchesSearch(const PlugIn& plugIn, std::string_view text);
// An explanation's outcome in words for people; `names` gives a plug-in's name for a UUID text.
std::string wordOutcome(const std::string& outcome, const std::function<std::string(const std::string&)>& names);
// What an entitlement a plug-in carries means to its user, or nothing for those that do not
// concern the user.
std::optional<std::string> wordEntitlement(const std::string& key, const corvane::Value& value);
// Rules a person typed: JSON, else the text notation; an empty text is no rules.
corvane::Result<corvane::Value> parseRules(std::string_view text);

class Extensions {
public:
    explicit Extensions(std::optional<std::string> serviceName = std::nullopt);
    ~Extensions();

    // The user's plug-ins, every registration of each.
    corvane::Result<Snapshot> load();
    // Sends "annotate" with the election (1 on, 0 off); the error axd gives, else ok.
    corvane::Status setElection(const UUID& uuid, bool elected);
    // axd's explanation for `hostPath` (a registered application) or for the panel itself (empty),
    // under `rules`.
    corvane::Result<std::vector<Explanation>> explain(const std::string& hostPath, const corvane::Value& rules,
                                                      const Snapshot& known);
    // The registered applications, by name.
    std::vector<Application> applications();

    // The consent services of the plug-in's application: those the user answered, and the
    // keyboard's network when one of its plug-ins asks for open access.
    corvane::Result<std::vector<ConsentService>> consentServices(const PlugIn& plugIn, const Snapshot& snapshot);
    corvane::Status setConsent(const std::string& applicationPath, const std::string& service, bool granted);
    // The sandbox profile the plug-in runs under now, and why.
    static std::pair<std::string, std::string> sandboxProfile(const PlugIn& plugIn, bool keyboardNetworkGranted);

    // Follows axd's events: `changed` runs (on a queue of the watch's own) after each install,
    // uninstall, annotation change and hold, and with `ended` true when the watch ended (axd went);
    // a later startWatch follows again.
    corvane::Status startWatch(std::function<void(bool ended)> changed);

private:
    AXDaemonClient client_;
    // Opened once, on first use: it follows other writers' changes itself.
    std::unique_ptr<corvane::vantry::Registry> registry_;
    struct Watch;
    std::unique_ptr<Watch> watch_;
};

}  // namespace annexa::extensions
