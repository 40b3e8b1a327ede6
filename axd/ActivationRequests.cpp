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
#include "platform/rpx/Wire.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

namespace {

constexpr uint64_t kHoldApplications = 1;
constexpr uint64_t kHoldPlugIns = 2;

std::string uuidText(const AXDPlugIn& plugIn) { return plugIn.uuid() ? plugIn.uuid()->string() : std::string(); }

}  // namespace

void Transaction::readyPlugIns() {
    auto list = resolveUuidList();
    if (!list) return;
    // Checked first, each once, and enabled only after every plug-in passed the checks; both walks
    // in slices, so that a host readying thousands of plug-ins holds no other client up.
    struct Ready {
        UuidList list;
        std::vector<AXDPlugInPtr> enable;
        std::set<UUID> chosen;
        std::optional<Error> first;
    };
    auto ready = std::make_shared<Ready>(Ready{std::move(*list), {}, {}, {}});
    auto check = [this, ready](size_t i) {
        const AXDPlugInPtr& plugIn = ready->list.plugIns[i];
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
        if (ready->chosen.insert(*plugIn->uuid()).second) ready->enable.push_back(plugIn);
        return Walk::Continue;
    };
    auto enable = [this, ready](size_t i) {
        Status enabled = ready->enable[i]->enableForClient(*client_);
        if (!enabled.ok() && !ready->first) ready->first = enabled.error();
        return Walk::Continue;  // every plug-in is tried, also after a failure
    };
    inSlices(ready->list.plugIns.size(), check, [this, ready, enable](bool checked) {
        if (!checked) return;
        if (ready->list.end) return failMessage(ready->list.end->first, ready->list.end->second);
        inSlices(ready->enable.size(), enable, [this, ready](bool) {
            giveBackMemoryAfter(ready->list.plugIns.size());
            if (ready->first) return failError(static_cast<AXErrorCode>(ready->first->code), *ready->first);
            done();
        });
    });
}

void Transaction::accessPlugIns() {
    auto list = resolveUuidList();
    if (!list) return;
    // The tokens are encoded for the reply as they are issued, slice by slice: thousands of them
    // make a reply of hundreds of kilobytes, which would otherwise be built in one go at the end.
    struct Access {
        UuidList list;
        std::shared_ptr<std::string> tokens = std::make_shared<std::string>();
    };
    auto access = std::make_shared<Access>(Access{std::move(*list)});
    corvane::rpx::wire::appendArrayHeader(*access->tokens, static_cast<uint32_t>(access->list.plugIns.size()));
    auto issue = [this, access](size_t i) {
        const AXDPlugInPtr& plugIn = access->list.plugIns[i];
        auto token = issueReadExtensionForURL(plugIn->url());
        if (!token) {
            failMessage(AXErrorCode::InvalidRequest,
                        log::formatText("cannot create extension to %@: %d", plugIn->url(), token.error().code));
            return Walk::Stop;
        }
        (void)corvane::rpx::wire::appendElement(*access->tokens, Value(std::move(*token)));
        return Walk::Continue;
    };
    inSlices(access->list.plugIns.size(), issue, [this, access](bool issued) {
        if (!issued) return;
        if (access->list.end) return failMessage(access->list.end->first, access->list.end->second);
        static const uint32_t kTextArray = Value(Array{Value("")}).kindsInside();
        reply_[message::kExtensions] =
            convertValueToMessage(corvane::rpx::wire::encodedContainer(std::move(access->tokens), 1, kTextArray));
        done();
        giveBackMemoryAfter(access->list.plugIns.size());
    });
}

void Transaction::lockDownPlugIns() {
    if (const Value& list = request()[message::kUuids]; list.isArray()) {
        if (corvane::rpx::arrayCount(list) > kMaxListElements) {
            return failMessage(AXErrorCode::InvalidRequest,
                               log::formatText("invalid request format (more than %u uuids)", static_cast<unsigned>(kMaxListElements)));
        }
        for (const Value& token : *list.asArray()) {
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
    if (!server().addHold(std::move(hold))) {
        return failMessage(AXErrorCode::InvalidRequest,
                           log::formatText("too many holds (%u on this connection)", static_cast<unsigned>(AXDServer::kMaxHoldsPerClient)));
    }
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
