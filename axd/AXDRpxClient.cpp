#include "axd/AXDRpxClient.h"

#include <cstdio>

#include "axd/AXDServer.h"
#include "axd/Transaction.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

AXDRpxClient::AXDRpxClient(const corvane::rpx::ConnectionPtr& connection, AXDServer* server)
    : connection_(connection),
      server_(server),
      pid_(connection->pid()),
      path_(connection->peer().executablePath),
      auditToken_(connection->peer().auditToken) {}

std::shared_ptr<AXDRpxClient> AXDRpxClient::initWithConnectionServer(const corvane::rpx::ConnectionPtr& connection,
                                                                     AXDServer* server) {
    auto client = std::shared_ptr<AXDRpxClient>(new AXDRpxClient(connection, server));
    log::debug(logOps(), "new client %d %s", client->pid_, client->path_);
    AXD_TRACE(client__new, client->pid_);
    connection->setContext(client, [](std::shared_ptr<void> context) { context.reset(); });
    connection->setEventHandler([client](const corvane::rpx::Event& event) { client->handleEvent(event); });
    connection->resume();
    return client;
}

const AXDRpxClient::Identity& AXDRpxClient::identity() const {
    std::call_once(identityOnce_, [this] {
        if (!path_.empty()) identity_.bundle = AXBundle::initWithExecutableURL(path_);
        identity_.task = corvane::codesign::Handle::fromAuditToken(auditToken_);
    });
    return identity_;
}

void AXDRpxClient::handleEvent(const corvane::rpx::Event& event) {
    if (event.error == corvane::rpx::ErrorKind::TerminationImminent) return dying();
    if (event.error == corvane::rpx::ErrorKind::ConnectionInvalid) return dead();
    if (!event.message.isDictionary()) {
        logUnexpected(event);
        // A sender that waits for an answer gets one rather than waiting for ever.
        if (auto conn = connection(); conn && event.wantsReply)
            conn->sendReply(event.messageId, Value(Dictionary{{message::kErrorCode, Value(static_cast<uint64_t>(errorCodeValue(
                                                                   AXErrorCode::InvalidRequest)))},
                                                              {message::kError, Value("invalid request format")}}));
        return;
    }
    if (AXD_TRACE_ENABLED(request__input)) {
        std::string text = event.message.description();
        AXD_TRACE(request__input, pid(), text.c_str());
    }
    (void)identity();
    auto transaction = std::make_shared<Transaction>(event, shared_from_this());
    auto work = [transaction] {
        AXDRpxClient& client = *transaction->client();
        uint32_t count = client.countRequest();
        if (count % 1000 == 0) log::debug(logOps(), "client %d used %u requests so far", client.pid(), count);
        transaction->dispatch();
    };
    Waiting request{std::move(work), transaction->onlyReads()};
    {
        corvane::MutexLock lock(sequenceMutex_);
        if (serving_) {
            waiting_.push_back(std::move(request));
            return;
        }
        serving_ = true;
    }
    start(std::move(request));
}

void AXDRpxClient::start(Waiting request) {
    if (request.reading) {
        server_->submitReadingWork(pid_, request.work);
    } else {
        server_->submitWork(pid_, std::move(request.work));
    }
}

void AXDRpxClient::requestEnded() {
    Waiting next;
    {
        corvane::MutexLock lock(sequenceMutex_);
        if (waiting_.empty()) {
            serving_ = false;
            return;
        }
        next = std::move(waiting_.front());
        waiting_.pop_front();
    }
    // Queued, never run here: this runs as a request ends, and a chain of requests run where they
    // end would nest one in the other.
    server_->submitWork(pid_, std::move(next.work));
}

int AXDRpxClient::pid() const { return connection_.expired() ? 0 : pid_; }

Value AXDRpxClient::entitlementValueForKey(const std::string& key) const {
    const auto& task = identity().task;
    if (!task) {
        log::error(logOps(), "error retrieving entitlements for client %d", pid());
        return Value();
    }
    return task->valueForEntitlement(key);
}

void AXDRpxClient::logUnexpected(const corvane::rpx::Event& event) {
    constexpr uint32_t kPerSecond = 5;
    constexpr size_t kShownBytes = 256;
    int64_t second = Date::now().wholeSeconds();
    if (second != unexpectedSecond_) {
        if (unexpectedInSecond_ > kPerSecond) {
            log::error(logOps(), "%u more unexpected messages from: %d not logged",
                       unexpectedInSecond_ - kPerSecond, pid());
        }
        unexpectedSecond_ = second;
        unexpectedInSecond_ = 0;
    }
    if (++unexpectedInSecond_ > kPerSecond) return;
    std::string text = event.message.description();
    if (text.size() > kShownBytes) text = text.substr(0, kShownBytes) + "...";
    log::error(logOps(), "unexpected message: %{public}@ from: %d", text, pid());
}

bool AXDRpxClient::hasEntitlement(const std::string& key) const {
    return entitlementGranted(entitlementValueForKey(key));
}

void AXDRpxClient::dying() { log::debug(logOps(), "client %d termination imminent", pid_); }

void AXDRpxClient::dead() {
    server_->unholdClient(this);
    log::debug(logOps(), "client %d is dead", pid_);
    acceptWork_.store(false);
    AXD_TRACE(client__done, pid_);
}

std::string AXDRpxClient::description() const {
    char addr[32];
    std::snprintf(addr, sizeof addr, "%p", static_cast<const void*>(this));
    auto conn = connection();
    if (!conn) return std::string("<AXDRpxClient ") + addr + " NO CONNECTION>";
    return std::string("<AXDRpxClient ") + addr + " con=" + conn->description() + " pid=" + std::to_string(pid()) +
           " path=" + path_ + ">";
}

}  // namespace annexa
