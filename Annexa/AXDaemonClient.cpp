#include "Annexa/AXDaemonClient.h"

#include "Annexa/AXMessage.h"

namespace annexa {

namespace log = corvane::log;
using corvane::rpx::Reply;

namespace {
// Set while this thread runs the operation of wait(): its request is sent and its reply read on
// this thread, with no hand-over to the reply queue and back.
thread_local bool tWaiting = false;

// A reply's text is made only when the traffic log shows it: a large reply's text costs more than
// decoding it.
void logReply(const Reply& r) {
    if (logTraffic().enabled(log::Level::Debug)) log::debug(logTraffic(), "reply: %@", r.description());
}
}  // namespace

AXDaemonClient::AXDaemonClient(const std::optional<std::string>& serviceName)
    : serviceName_(serviceName.value_or(kDefaultServiceName)),
      replyQueue_(corvane::dispatch::Queue::create("axd_client")) {
    corvane::MutexLock lock(mutex_);
    axd_ = connectLocked();
}

AXDaemonClient::~AXDaemonClient() {
    corvane::MutexLock lock(mutex_);
    // Closing is no communications error.
    axd_->setEventHandler(nullptr);
    axd_->cancel();
}

std::shared_ptr<corvane::rpx::Connection> AXDaemonClient::connectLocked() {
    auto connection = corvane::rpx::Connection::connect(serviceName_, replyQueue_);
    connection->setEventHandler([](const corvane::rpx::Event& ev) {
        log::error(logOps(), "Communications error: %{public}@", ev.description());
    });
    connection->resume();
    return connection;
}

std::shared_ptr<corvane::rpx::Connection> AXDaemonClient::connection() {
    corvane::MutexLock lock(mutex_);
    if (!axd_->isValid()) {
        log::debug(logOps(), "connecting again to %{public}@", serviceName_);
        axd_->setEventHandler(nullptr);
        axd_ = connectLocked();
    }
    return axd_;
}

Dictionary AXDaemonClient::request(const std::string& name) const {
    return Dictionary{{message::kRequest, name}, {message::kVersion, Value(protocolVersion_.load())}};
}

Dictionary AXDaemonClient::requestPaths(const std::string& name, const std::vector<std::string>& paths) const {
    Dictionary m = request(name);
    Array list(paths.begin(), paths.end());
    m[message::kPaths] = convertValueToMessage(Value(std::move(list)));
    return m;
}

void AXDaemonClient::setUuids(Dictionary& message, const std::vector<UUID>& uuids) {
    Array list(uuids.begin(), uuids.end());
    message[message::kUuids] = Value(std::move(list));
}

void AXDaemonClient::send(const Value& message, Completion reply) {
    if (logTraffic().enabled(log::Level::Debug)) log::debug(logTraffic(), "request: %@", message);
    if (tWaiting) {
        tWaiting = false;  // one request per operation; any further one goes the usual way
        Reply r = connection()->sendWithReplySync(message);
        // Completions of earlier requests were queued before this reply came; they run first.
        replyQueue_->sync([] {});
        logReply(r);
        reply(r);
        return;
    }
    connection()->sendWithReply(message, replyQueue_, [reply = std::move(reply)](const Reply& r) {
        logReply(r);
        reply(r);
    });
}

void AXDaemonClient::addPlugIns(const std::vector<std::string>& paths, Completion reply) {
    send(Value(requestPaths(request::kAdd, paths)), std::move(reply));
}

void AXDaemonClient::removePlugIns(const std::vector<std::string>& paths, Completion reply) {
    send(Value(requestPaths(request::kRemove, paths)), std::move(reply));
}

void AXDaemonClient::bulkPlugIns(uint64_t flags, Completion reply) {
    Dictionary m = request(request::kBulk);
    m[message::kFlags] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::readyPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply) {
    Dictionary m = request(request::kReady);
    m[message::kFlags] = Value(flags);
    setUuids(m, uuids);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::accessPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply) {
    Dictionary m = request(request::kAccess);
    m[message::kFlags] = Value(flags);
    setUuids(m, uuids);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::matchPlugIns(const Value& rules, uint64_t flags, Completion reply) {
    Dictionary m = request(request::kMatch);
    m[message::kRules] = convertValueToMessage(rules);
    m[message::kFlags] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::setPlugInAnnotations(const std::vector<UUID>& uuids, const Value& annotations,
                                          Completion reply) {
    Dictionary m = request(request::kAnnotate);
    setUuids(m, uuids);
    m[message::kAnnotations] = convertValueToMessage(annotations);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::bulkSetPlugInAnnotations(const Value& annotations, Completion reply) {
    Dictionary m = request(request::kBulkAnnotate);
    m[message::kAnnotations] = convertValueToMessage(annotations);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::holdPlugIns(const std::vector<std::string>& paths, uint64_t flags, Completion reply) {
    Dictionary m = requestPaths(request::kLock, paths);
    m[message::kFlags] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::releaseHold(const UUID& token, Completion reply) {
    Dictionary m = request(request::kLock);
    setUuids(m, {token});
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::copyReceipt(Completion reply) { send(Value(request(request::kReceipt)), std::move(reply)); }

Reply AXDaemonClient::wait(const std::function<void(Completion)>& operation) {
    replyQueue_->assertNotCurrent();
    return corvane::dispatch::waitForCallback<Reply>([&](Completion done) {
        tWaiting = true;
        operation(std::move(done));
        tWaiting = false;
    });
}

Status AXDaemonClient::errorInReply(const Reply& reply) {
    if (!reply.ok()) return makeError(AXErrorCode::InvalidRequest, reply.description());
    uint64_t code = reply.value[message::kErrorCode].uint64Value().value_or(0);
    const std::string* text = reply.value[message::kError].asString();
    if (code == 0 && !text) return {};
    if (code == 0) {
        return makeErrorWithFormat(AXErrorCode::InvalidRequest, "axd reported error without a code: %s", *text);
    }
    auto replyCode = static_cast<AXErrorCode>(code);
    Error error = makeError(replyCode, text ? *text : "unknown error returned by Annexa subsystem");
    if (const std::string* reason = reply.value[message::kReason].asString()) error.cause = *reason;
    return error;
}

std::optional<Value> AXDaemonClient::convertFromRPX(const Value& message) const {
    if (protocolVersion_ != kCurrentProtocolVersion) return std::nullopt;
    return convertMessageToValue(message);
}

std::optional<Value> AXDaemonClient::convertToRPX(const Value& value, uint64_t version) {
    if (version != kCurrentProtocolVersion) return std::nullopt;
    return convertValueToMessage(value);
}

}  // namespace annexa
