#include "Annexa/AXDaemonClient.h"

#include <stdexcept>

#include "Annexa/AXMessage.h"

namespace annexa {

namespace log = corvane::log;
using corvane::rpx::Reply;

AXDaemonClient::AXDaemonClient(const std::optional<std::string>& serviceName)
    : replyQueue_(corvane::dispatch::Queue::create("axd_client")),
      axd_(corvane::rpx::Connection::connect(serviceName.value_or(kDefaultServiceName), replyQueue_)) {
    axd_->setEventHandler([](const corvane::rpx::Event& ev) {
        log::error(logOps(), "Communications error: %{public}@", ev.description());
    });
    axd_->resume();
}

AXDaemonClient::~AXDaemonClient() {
    // Closing is no communications error.
    axd_->setEventHandler(nullptr);
    axd_->cancel();
}

Dictionary AXDaemonClient::request(const std::string& name) const {
    return Dictionary{{"request", name}, {"version", Value(static_cast<uint64_t>(protocolVersion_.load()))}};
}

Dictionary AXDaemonClient::requestPaths(const std::string& name, const std::vector<std::string>& paths) const {
    Dictionary m = request(name);
    Array list(paths.begin(), paths.end());
    m["paths"] = convertValueToMessage(Value(std::move(list)));
    return m;
}

void AXDaemonClient::setUuids(Dictionary& message, const std::vector<UUID>& uuids) {
    Array list(uuids.begin(), uuids.end());
    message["uuids"] = Value(std::move(list));
}

void AXDaemonClient::send(const Value& message, Completion reply) {
    log::debug(logTraffic(), "request: %@", message);
    axd_->sendWithReply(message, replyQueue_, [reply = std::move(reply)](const Reply& r) {
        log::debug(logTraffic(), "reply: %@", r.description());
        reply(r);
    });
}

void AXDaemonClient::addPlugIns(const std::vector<std::string>& paths, Completion reply) {
    send(Value(requestPaths("add", paths)), std::move(reply));
}

void AXDaemonClient::removePlugIns(const std::vector<std::string>& paths, Completion reply) {
    send(Value(requestPaths("remove", paths)), std::move(reply));
}

void AXDaemonClient::bulkPlugins(uint64_t flags, Completion reply) {
    Dictionary m = request("bulk");
    m["flags"] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::readyPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply) {
    Dictionary m = request("ready");
    m["flags"] = Value(flags);
    setUuids(m, uuids);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::accessPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply) {
    Dictionary m = request("access");
    m["flags"] = Value(flags);
    setUuids(m, uuids);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::matchPlugIns(const Value& rules, uint64_t flags, Completion reply) {
    Dictionary m = request("match");
    m["rules"] = convertValueToMessage(rules);
    m["flags"] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::setPluginAnnotations(const std::vector<UUID>& uuids, const Value& annotations,
                                          Completion reply) {
    Dictionary m = request("annotate");
    setUuids(m, uuids);
    m["annotations"] = convertValueToMessage(annotations);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::bulkSetPluginAnnotations(const Value& annotations, Completion reply) {
    Dictionary m = request("bulk-annotate");
    m["annotations"] = convertValueToMessage(annotations);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::holdPlugins(const std::vector<std::string>& paths, uint64_t flags, Completion reply) {
    Dictionary m = requestPaths("lock", paths);
    m["flags"] = Value(flags);
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::releaseHold(const UUID& token, Completion reply) {
    Dictionary m = request("lock");
    setUuids(m, {token});
    send(Value(std::move(m)), std::move(reply));
}

void AXDaemonClient::copyReceipt(Completion reply) { send(Value(request("receipt")), std::move(reply)); }

Reply AXDaemonClient::wait(const std::function<void(Completion)>& operation) {
    replyQueue_->assertNotCurrent();
    return corvane::dispatch::waitForCallback<Reply>(operation);
}

std::optional<Error> AXDaemonClient::errorInReply(const Reply& reply) {
    if (!reply.ok()) return makeError(4, reply.description());
    uint64_t code = reply.value["errorcode"].uint64Value().value_or(0);
    const std::string* text = reply.value["error"].asString();
    if (code == 0 && !text) return std::nullopt;
    if (code == 0) throw std::logic_error(log::formatText("axd reported error without a code: %s", *text));
    if (text) return makeError(static_cast<int64_t>(code), *text);
    return makeError(static_cast<int64_t>(code), "unknown error returned by Annexa subsystem");
}

std::optional<Value> AXDaemonClient::convertFromRPX(const Value& message) const {
    if (protocolVersion_ != kProtocolVersion) return std::nullopt;
    return convertMessageToValue(message);
}

std::optional<Value> AXDaemonClient::convertToRPX(const Value& value, int64_t version) {
    if (version != kProtocolVersion) return std::nullopt;
    return convertValueToMessage(value);
}

}  // namespace annexa
