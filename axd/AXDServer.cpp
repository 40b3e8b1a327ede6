#include "axd/AXDServer.h"

#include <systemd/sd-daemon.h>
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

AXDPlugInHold::AXDPlugInHold(const std::vector<AXDPlugInPtr>& plugIns, const std::shared_ptr<AXDRpxClient>& client)
    : uuid_(UUID::random()), client_(client), clientIdentity_(client.get()), created_(Date::now()) {
    Array summaries;
    for (const auto& p : plugIns) {
        blocked_.insert(*p->uuid());
        summaries.push_back(AXDWatchers::summary(*p));
    }
    plugIns_ = Value(std::move(summaries));
    corvane::rpx::beginWork();
}

AXDPlugInHold::~AXDPlugInHold() { corvane::rpx::endWork(); }

bool AXDPlugInHold::blocks(const AXDPlugIn& plugIn) const { return blocked_.count(*plugIn.uuid()) > 0; }

bool AXDPlugInHold::heldBy(const AXDRpxClient* client) const { return clientIdentity_ == client && !client_.expired(); }

// ---- server

AXDServer::AXDServer(const char* database, std::shared_ptr<corvane::vantry::Registry> registry)
    : AXDatabase(database, std::move(registry)),
      rpxQueue_(Queue::create("rpx")),
      mainQueue_(Queue::create("service", corvane::dispatch::QoS::UserInitiated)),
      syncQueue_(Queue::create("serverSync")) {}

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

void AXDServer::submitWork(std::function<void()> work) { mainQueue_->async(std::move(work)); }

void AXDServer::submitReadingWork(const std::function<void()>& work) {
    if (!mainQueue_->runIfIdle(work)) mainQueue_->async(work);
}

void AXDServer::addHold(std::shared_ptr<AXDPlugInHold> hold) {
    Value event = corvane::dict({{"event", "hold"}, {"token", hold->uuid()}, {"plugins", hold->plugIns()}});
    syncQueue_->sync([&] {
        syncQueue_->assertCurrent();
        holds_.push_back(std::move(hold));
        ++holdsChanges_;
    });
    (void)corvane::notify::post(kAnnotationChangeNotification);
    watchers().publish(event);
}

namespace {

Value releaseEvent(const AXDPlugInHold& hold) {
    return corvane::dict({{"event", "release"}, {"token", hold.uuid()}, {"plugins", hold.plugIns()}});
}

}  // namespace

void AXDServer::unholdToken(const UUID& token) {
    std::shared_ptr<AXDPlugInHold> released;
    syncQueue_->sync([&] {
        syncQueue_->assertCurrent();
        for (auto it = holds_.begin(); it != holds_.end(); ++it) {
            if ((*it)->uuid() != token) continue;
            log::debug(logOps(), "releasing plug-in hold %{public}@ at client's request", token);
            released = *it;
            holds_.erase(it);
            ++holdsChanges_;
            (void)corvane::notify::post(kAnnotationChangeNotification);
            return;
        }
    });
    if (released) watchers().publish(releaseEvent(*released));
}

void AXDServer::unholdClient(const AXDRpxClient* client) {
    std::vector<std::shared_ptr<AXDPlugInHold>> released;
    syncQueue_->sync([&] {
        syncQueue_->assertCurrent();
        for (;;) {
            auto it = std::find_if(holds_.begin(), holds_.end(),
                                   [&](const auto& h) { return h->heldBy(client); });
            if (it == holds_.end()) break;
            log::debug(logOps(), "releasing plug-in hold %{public}@ for dead client pid %d", (*it)->uuid().string(),
                       client->pid());
            released.push_back(*it);
            holds_.erase(it);
            ++holdsChanges_;
            (void)corvane::notify::post(kAnnotationChangeNotification);
        }
    });
    for (const auto& hold : released) watchers().publish(releaseEvent(*hold));
}

bool AXDServer::holdOnPlugIn(const AXDPlugIn& plugIn) {
    return syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        return std::any_of(holds_.begin(), holds_.end(), [&](const auto& h) { return h->blocks(plugIn); });
    });
}

std::vector<std::shared_ptr<const AXDPlugInHold>> AXDServer::currentHolds() {
    return syncQueue_->syncResult([&] {
        syncQueue_->assertCurrent();
        return std::vector<std::shared_ptr<const AXDPlugInHold>>(holds_.begin(), holds_.end());
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
