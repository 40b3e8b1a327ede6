// Privacy consent: which platform services the user has granted to an application (docs/pcx.md).
//
// The records live in one property list per user, <per-user data>/pcx/consent.plist, a dictionary
// from an application's bundle identifier to a dictionary from a service identifier to whether it
// is granted. The user changes them with the pcx tool; the service manager's daemon answers the
// question on the rpx endpoint "com.corvane.pcx": a caller whose verified signature carries
// kManagerEntitlement may ask about any bundle, any other only about the bundle whose executable it
// runs.
//
// Thread-safety: every function may be called from any thread; the store is read afresh on every
// call and replaced whole on every change.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/Dispatch.h"
#include "platform/rpx/Rpx.h"
#include "platform/value/Value.h"

namespace corvane::pcx {

inline constexpr const char* kEndpoint = "com.corvane.pcx";
inline constexpr const char* kManagerEntitlement = "com.corvane.private.pcx.manager";
// A keyboard's access to the network.
inline constexpr const char* kKeyboardNetworkService = "com.corvane.pcx.keyboard-network";
// The two entries of a consent record.
inline constexpr const char* kServiceKey = "service";
inline constexpr const char* kGrantedKey = "granted";

struct Record {
    std::string service;
    bool granted = false;
};

// <per-user data>/pcx/consent.plist under the current platform root.
std::string storePath();
// The bundle identifier of the application at `bundlePath` (its Info.plist's "KFBundleIdentifier").
Result<std::string> bundleIdentifierAt(const std::string& bundlePath);
// The records of one application, in the order of their service identifiers. A store that does not
// exist yet holds none; one that cannot be read is an error.
Result<std::vector<Record>> recordsForBundle(const std::string& bundlePath);
// Every application's records, by bundle identifier.
Result<Value> allRecords();
// Records the user's answer for one service of one application (a revoked service keeps its
// record, with granted false).
Status setConsent(const std::string& bundlePath, const std::string& service, bool granted);

// Asks the daemon for the records of a bundle: an array of dictionaries with kServiceKey and
// kGrantedKey; nullopt when the daemon cannot be reached or refuses.
std::optional<Array> consentInformationForBundle(const std::string& bundlePath);

// The endpoint, served on `queue` until destroyed.
class Service {
public:
    static Result<std::unique_ptr<Service>> start(dispatch::QueuePtr queue);
    ~Service();

private:
    explicit Service(std::shared_ptr<rpx::Listener> listener) : listener_(std::move(listener)) {}
    std::shared_ptr<rpx::Listener> listener_;
};

}  // namespace corvane::pcx
