// The requests that get plug-ins ready for a host ("ready", "access"), hold them ("lock") and hand
// a plug-in its application's receipt ("receipt").
#include <set>

#include "Annexa/AXMessage.h"
#include "Annexa/AXSandboxExtension.h"
#include "axd/AXDRpxClient.h"
#include "axd/AXDServer.h"
#include "axd/Transaction.h"
#include "platform/bundle/Bundle.h"
#include "platform/plist/Plist.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

namespace {

constexpr uint64_t kHoldApplications = 1;
constexpr uint64_t kHoldPlugIns = 2;

std::string uuidText(const AXDPlugIn& plugIn) { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); }

}  // namespace

void Transaction::readyPlugIns() {
    // Once each, and only after every plug-in passed the checks.
    std::vector<AXDPlugInPtr> enable;
    std::set<UUID> chosen;
    bool walked = processUuidList([&](const AXDPlugInPtr& plugIn) {
        std::string uuid = uuidText(*plugIn);
        AXD_TRACE(plugin__ready, uuid.c_str());
        std::optional<std::string> refusal;
        if (server().holdOnPlugIn(*plugIn)) {
            refusal = "the plug-in is on hold";
        } else if (plugIn->isData()) {
            return Walk::Continue;
        } else {
            refusal = plugIn->allowForClient(*client_);
        }
        if (refusal) {
            log::notice(logOps(), "denied access to %d for plugin %@(%{public}@): %{public}@", client_->pid(),
                        plugIn->identifier(), uuid, *refusal);
            failMessage(AXErrorCode::NotEntitled,
                        log::formatText("access to plugin %@ denied: %@", plugIn->identifier(), *refusal));
            return Walk::Stop;
        }
        if (chosen.insert(*plugIn->uuid()).second) enable.push_back(plugIn);
        return Walk::Continue;
    });
    if (!walked) return;
    std::optional<Error> first;
    for (const AXDPlugInPtr& plugIn : enable) {
        Status enabled = plugIn->enableForClient(*client_);
        if (!enabled.ok() && !first) first = enabled.error();
    }
    if (first) return failError(static_cast<AXErrorCode>(first->code), *first);
    done();
}

void Transaction::accessPlugIns() {
    Array tokens;
    bool walked = processUuidList([&](const AXDPlugInPtr& plugIn) {
        auto token = issueReadExtensionForURL(plugIn->url());
        if (!token) {
            failMessage(AXErrorCode::InvalidRequest,
                        log::formatText("cannot create extension to %@: %d", plugIn->url(), token.error().code));
            return Walk::Stop;
        }
        tokens.emplace_back(*token);
        return Walk::Continue;
    });
    if (!walked) return;
    reply_[message::kExtensions] = convertValueToMessage(Value(std::move(tokens)));
    done();
}

void Transaction::lockDownPlugIns() {
    if (const Array* tokens = request()[message::kUuids].asArray()) {
        for (const Value& token : *tokens) {
            // An element that is no UUID names no hold: passed over like an unknown token.
            if (const UUID* uuid = token.asUUID()) server().unholdToken(*uuid);
        }
        return done();
    }
    uint64_t flags = flagsArgument();
    std::vector<AXDPlugInPtr> plugIns;
    bool walked = marshalPaths([&](const std::string& path, bool resolved) {
        if (!resolved) {
            failMessage(AXErrorCode::BadPath, log::formatText("invalid path: %@", path));
            return Walk::Stop;
        }
        if (flags == kHoldPlugIns) {
            AXDPlugInPtr plugIn = server().findPlugInAtPath(path);
            if (!plugIn) {
                failMessage(AXErrorCode::BadPath, log::formatText("no plug-in at path:%@", path));
                return Walk::Stop;
            }
            plugIns.push_back(std::move(plugIn));
        } else if (flags == kHoldApplications) {
            if (auto within = server().plugInsWithinApplication(path)) {
                plugIns.insert(plugIns.end(), within->begin(), within->end());
            }
        } else {
            failMessage(AXErrorCode::InvalidRequest, "invalid request format (unsupported hold flags)");
            return Walk::Stop;
        }
        return Walk::Continue;
    });
    if (!walked) return;
    Array conflicts;
    std::vector<std::string> busy;
    if (flags != kHoldPlugIns) {
        for (const AXDPlugInPtr& plugIn : plugIns) {
            if (auto conflict = plugIn->checkBusy()) {
                busy.push_back(plugIn->description());
                conflicts.push_back(*conflict);
            }
        }
    }
    if (!conflicts.empty()) {
        log::debug(logOps(), "hold rejected. Busy plug-ins:%@", Value(Array(busy.begin(), busy.end())));
        reply_[message::kConflicts] = Value(std::move(conflicts));
        return failMessage(AXErrorCode::Busy, "plug-ins are busy");
    }
    auto hold = std::make_shared<AXDPlugInHold>(plugIns, client_);
    UUID token = hold->uuid();
    server().addHold(std::move(hold));
    reply_[message::kUuids] = Value(token);
    log::debug(logOps(), "hold request granted uuid:%{public}@", token);
    done();
}

void Transaction::fetchReceipt() {
    auto bundlePath = client_->bundle() ? client_->bundle()->path() : std::nullopt;
    auto record = bundlePath ? server().workspace().plugInForPath(*bundlePath) : nullptr;
    if (!record) return failMessage(AXErrorCode::RegistryRefused, "caller is not a known plug-in");
    const auto& application = record->containingApplication();
    if (!application) return failMessage(AXErrorCode::ReceiptUnavailable, "no containing App for receipt");
    std::optional<std::string> receipt = application->receiptPath();
    if (!receipt) {
        if (auto bundle = corvane::bundle::Bundle::openPath(application->bundlePath())) {
            bundle->flush();
            receipt = bundle->receiptPath();
        }
    }
    if (!receipt) return failMessage(AXErrorCode::ReceiptUnavailable, "unable to locate receipt location");
    // The application's file, which may have been swapped for a FIFO, a device or a huge file since
    // it was registered: read without blocking and only up to its limit.
    auto bytes = corvane::bundle::readFileOfBundle(*receipt, corvane::bundle::kMaxReceiptSize);
    if (!bytes) {
        log::error(logOps(), "cannot read the receipt for client %d: %{public}@", client_->pid(), bytes.error());
        return failMessage(AXErrorCode::ReceiptUnavailable, "cannot locate containing receipt");
    }
    reply_[message::kData] = Value::data(bytes->data(), bytes->size());
    done();
}

}  // namespace annexa
