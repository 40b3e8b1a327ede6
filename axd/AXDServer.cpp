#include "axd/AXDServer.h"

#include <systemd/sd-daemon.h>
#include <malloc.h>
#include <unistd.h>

#include "axd/AXDRpxClient.h"
#include "platform/notify/Notify.h"
#include "platform/spawn/Spawn.h"

namespace annexa {

namespace log = corvane::log;
using corvane::dispatch::Queue;

namespace {
std::shared_ptr<AXDServer> gServer;  // set once during construction, never cleared
}  // namespace

// ---- holds

namespace {
std::atomic<uint64_t> gHoldSerials{0};
}  // namespace

AXDPlugInHold::AXDPlugInHold(const std::vector<AXDPlugInPtr>& plugIns, const std::shared_ptr<AXDRpxClient>& client)
    : uuid_(UUID::random()),
      serial_(++gHoldSerials),
      holderPid_(client ? client->pid() : 0),
      client_(client.get()),
      created_(Date::now()) {
    std::unordered_set<UUID, corvane::UUIDHash> seen;
    for (const auto& p : plugIns) {
        if (seen.insert(*p->uuid()).second) plugIns_.push_back(p);
    }
    plugIns_.shrink_to_fit();
    corvane::rpx::beginWork();
}

Value AXDPlugInHold::summaries() const {
    Array summaries;
    summaries.reserve(plugIns_.size());
    for (const auto& p : plugIns_) summaries.push_back(AXDWatchers::summary(*p));
    return Value(std::move(summaries));
}

AXDPlugInHold::~AXDPlugInHold() { corvane::rpx::endWork(); }

// ---- server

AXDServer::AXDServer(const char* database, std::shared_ptr<corvane::vantry::Registry> registry)
    : AXDatabase(database, std::move(registry)),
      rpxQueue_(Queue::create("rpx")),
      mainQueue_(Queue::create("service", corvane::dispatch::QoS::UserInitiated)),
      turns_(mainQueue_),
      syncQueue_(Queue::create("serverSync")),
      releaseQueue_(Queue::create("holdRelease", corvane::dispatch::QoS::Background)) {}

std::shared_ptr<AXDServer> AXDServer::initForService(const std::string& serviceName, const char* database,
                                                     std::shared_ptr<corvane::vantry::Registry> registry) {
    auto server = std::shared_ptr<AXDServer>(new AXDServer(database, std::move(registry)));
    auto listener = corvane::rpx::Listener::create(serviceName, server->rpxQueue_);
    if (!listener) {
        log::error(logOps(), "cannot listen on %{public}@: %{public}@", serviceName, listener.error().description());
        return nullptr;
    }
    server->service_ = *listener;
    // A client's handler wraps each request and hands it to the service queue (or, for a request
    // that only reads, runs it when the queue is idle), so it runs on the I/O thread rather than
    // costing a further thread hand-over per request.
    server->service_->setInlineDelivery(true);
    gServer = server;
    server->setDelegate(server.get());
    AXDServer* raw = server.get();
    server->service_->setConnectionHandler([raw](corvane::rpx::ConnectionPtr connection) {
        // The client lives on through its connection.
        AXDRpxClient::initWithConnectionServer(connection, raw);
    });
    server->userPrefs_ = std::make_unique<AXDUserPrefs>();
    return server;
}

AXDServer* AXDServer::server() { return gServer.get(); }

void AXDServer::run() {
    service_->resume();
    corvane::rpx::closeUnclaimedSockets();
    // A service manager that started us (Type=notify) learns that clients are served from now on;
    // without one this does nothing.
    std::string status = "READY=1\nSTATUS=serving " + service_->path();
    sd_notify(0, status.c_str());
    for (;;) pause();
}

void AXDServer::submitWork(pid_t client, std::function<void()> work) {
    turns_.async(static_cast<uint64_t>(client), std::move(work));
}

void AXDServer::submitReadingWork(pid_t client, const std::function<void()>& work) {
    if (!turns_.runIfIdle(static_cast<uint64_t>(client), work)) turns_.async(static_cast<uint64_t>(client), work);
}

namespace {

// What watchers learn of a hold: who holds it and what, never its token.
Value holdEvent(const char* kind, const AXDPlugInHold& hold) {
    return corvane::dict({{"event", kind}, {"hold", hold.serial()}, {"pid", int64_t{hold.holderPid()}}, {"plugins", hold.summaries()}});
}

Value releaseEvent(const AXDPlugInHold& hold) { return holdEvent("release", hold); }

}  // namespace

bool AXDServer::addHold(std::shared_ptr<AXDPlugInHold> hold) {
    Value event = holdEvent("hold", *hold);
    bool added = syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        const AXDRpxClient* client = hold->client();
        // A client already gone (its holds were released as it went) keeps nothing.
        if (client && client->holdsReleased()) return false;
        auto& tokens = holdsByClient_[client];
        if (tokens.size() >= kMaxHoldsPerClient) return false;
        tokens.push_back(hold->uuid());
        for (const auto& plugIn : hold->plugIns()) ++heldCounts_[*plugIn->uuid()];
        holds_.emplace(hold->uuid(), std::move(hold));
        ++holdsChanges_;
        return true;
    });
    if (!added) return false;
    (void)corvane::notify::post(kAnnotationChangeNotification);
    watchers().publish(event);
    return true;
}

std::shared_ptr<AXDPlugInHold> AXDServer::forgetHold(const UUID& token) {
    auto it = holds_.find(token);
    if (it == holds_.end()) return nullptr;
    std::shared_ptr<AXDPlugInHold> hold = std::move(it->second);
    holds_.erase(it);
    for (const auto& plugIn : hold->plugIns()) {
        auto count = heldCounts_.find(*plugIn->uuid());
        if (count != heldCounts_.end() && --count->second == 0) heldCounts_.erase(count);
    }
    ++holdsChanges_;
    return hold;
}

void AXDServer::unholdToken(const UUID& token) {
    std::shared_ptr<AXDPlugInHold> released;
    syncQueue_->sync([&] {
        syncQueue_->assertCurrent();
        released = forgetHold(token);
        if (!released) return;
        auto tokens = holdsByClient_.find(released->client());
        if (tokens != holdsByClient_.end()) {
            std::erase(tokens->second, token);
            if (tokens->second.empty()) holdsByClient_.erase(tokens);
        }
    });
    if (!released) return;
    log::debug(logOps(), "releasing plug-in hold %{public}@ at client's request", token);
    (void)corvane::notify::post(kAnnotationChangeNotification);
    watchers().publish(releaseEvent(*released));
}

void AXDServer::unholdClient(AXDRpxClient* client) {
    auto released = std::make_shared<std::vector<std::shared_ptr<AXDPlugInHold>>>();
    syncQueue_->sync([&] {
        syncQueue_->assertCurrent();
        client->setHoldsReleased();
        auto tokens = holdsByClient_.find(client);
        if (tokens == holdsByClient_.end()) return;
        released->reserve(tokens->second.size());
        for (const UUID& token : tokens->second) {
            if (auto hold = forgetHold(token)) released->push_back(std::move(hold));
        }
        holdsByClient_.erase(tokens);
    });
    if (released->empty()) return;
    // Matches see the holds gone from here on; one notification says so for all of them.
    (void)corvane::notify::post(kAnnotationChangeNotification);
    // The events and the freeing cost what the client held, up to a thousand holds: they are done
    // on a queue of their own so that the connection's thread and the requests of others go on.
    ++releasesQueued_;
    releaseQueue_->async([this, released, pid = client->pid()] {
        for (const auto& hold : *released) {
            log::debug(logOps(), "releasing plug-in hold %{public}@ for dead client pid %d", hold->uuid(), pid);
            watchers().publish(releaseEvent(*hold));
        }
        // Many holds gone leave their memory spread through the heap: it goes back once the
        // releases queued together are done (many clients with many holds go at once).
        holdsFreedSinceTrim_ += released->size();
        released->clear();
        if (--releasesQueued_ == 0 && holdsFreedSinceTrim_ >= 256) {
            holdsFreedSinceTrim_ = 0;
            malloc_trim(0);
        }
    });
}

bool AXDServer::holdOnPlugIn(const AXDPlugIn& plugIn) {
    return syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        return heldCounts_.count(*plugIn.uuid()) > 0;
    });
}

std::shared_ptr<const HeldPlugIns> AXDServer::heldPlugIns() {
    return syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        uint64_t changes = holdsChanges_.load();
        if (!heldSnapshot_ || heldSnapshotChanges_ != changes) {
            auto held = std::make_shared<HeldPlugIns>();
            held->reserve(heldCounts_.size());
            for (const auto& [uuid, count] : heldCounts_) held->insert(uuid);
            heldSnapshot_ = std::move(held);
            heldSnapshotChanges_ = changes;
        }
        return heldSnapshot_;
    });
}

size_t AXDServer::holdCount() {
    return syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        return holds_.size();
    });
}

void AXDServer::removedPlugIns(const std::vector<corvane::vantry::PlugInRecordPtr>& records) {
    // The service manager is asked from a queue of its own, so that an unreachable one holds up
    // neither the registry's events nor requests; the outcome is only logged, on the service queue.
    static const corvane::dispatch::QueuePtr terminations = corvane::dispatch::Queue::create("spawnd-terminations");
    for (const auto& r : records) {
        log::debug(logOps(), "requesting spawnd termination of plug-in: %s(%s) %{public}@", r->bundleIdentifier(),
                   r->bundleVersion(), r->uuid().string());
        terminations->async([identifier = r->bundleIdentifier(), version = r->bundleVersion(), main = mainQueue_] {
            int result = corvane::spawn::removeExternalService(identifier, version);
            main->async([result] {
                if (result == 0) {
                    log::debug(logOps(), "spawnd reported plug-ins have been terminated");
                } else if (result == corvane::spawn::kNothingOnRecord) {
                    log::debug(logOps(), "spawnd reported no plug-ins on record");
                } else {
                    log::info(logOps(), "spawnd error attempting to terminate plug-ins: error=%d", result);
                }
            });
        });
    }
}

}  // namespace annexa
