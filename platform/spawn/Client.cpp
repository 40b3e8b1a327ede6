// The client side of spawnd's endpoints and the plug-in's side of its control connection.
#include <fcntl.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <map>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/spawn/Protocol.h"
#include "platform/spawn/Spawn.h"

namespace corvane::spawn {

namespace {

dispatch::QueuePtr clientQueue() {
    static const dispatch::QueuePtr queue = dispatch::Queue::create("com.corvane.spawn.client");
    return queue;
}

// One request. The process keeps one connection per endpoint (by its path, so per platform root)
// and makes a new one when that has ended: a daemon that restarted is reached again, and a request
// sent on a connection that ended meanwhile is sent once more on a fresh one.
std::optional<Value> roundTrip(const char* endpoint, const Value& request) {
    static Mutex mutex;
    static std::map<std::string, rpx::ConnectionPtr>* connections = new std::map<std::string, rpx::ConnectionPtr>();
    std::string path = rpx::endpointPath(endpoint);
    for (int attempt = 0; attempt < 2; ++attempt) {
        rpx::ConnectionPtr connection;
        {
            MutexLock lock(mutex);
            rpx::ConnectionPtr& slot = (*connections)[path];
            if (!slot || !slot->isValid()) {
                slot = rpx::Connection::connect(endpoint, clientQueue());
                slot->setEventHandler([](const rpx::Event&) {});
                slot->resume();
            }
            connection = slot;
        }
        rpx::Reply reply = connection->sendWithReplySync(request);
        if (reply.ok()) return reply.value;
        MutexLock lock(mutex);
        rpx::ConnectionPtr& slot = (*connections)[path];
        if (slot == connection) slot = nullptr;
    }
    return std::nullopt;
}

int resultOf(const std::optional<Value>& reply) {
    if (!reply) return EHOSTUNREACH;
    return static_cast<int>((*reply)[protocol::kResult].int64Value().value_or(EPROTO));
}

}  // namespace

int addExternalService(pid_t hostPid, const std::string& executablePath, const Value& overlay, std::string* reason) {
    auto reply = roundTrip(kEndpoint, dict({{protocol::kRequest, protocol::kAdd},
                                            {protocol::kHost, int64_t{hostPid}},
                                            {protocol::kExecutable, executablePath},
                                            {protocol::kOverlay, overlay}}));
    int result = resultOf(reply);
    if (result != 0 && reason) {
        const std::string* text = reply ? (*reply)[protocol::kError].asString() : nullptr;
        *reason = text ? *text
              : reply  ? std::string("spawnd gave no reason (error ") + std::to_string(result) + ")"
                       : "spawnd cannot be reached: " + rpx::unreachableText(kEndpoint, "spawnd.socket");
    }
    return result;
}

int removeExternalService(const std::string& bundleIdentifier, const std::string& bundleVersion) {
    return resultOf(roundTrip(kEndpoint, dict({{protocol::kRequest, protocol::kRemove},
                                               {protocol::kBundleIdentifier, bundleIdentifier},
                                               {protocol::kBundleVersion, bundleVersion}})));
}

Result<std::shared_ptr<FileDescriptor>> connectToService(const std::string& bundleIdentifier) {
    auto reply = roundTrip(kEndpoint, dict({{protocol::kRequest, protocol::kConnect},
                                            {protocol::kBundleIdentifier, bundleIdentifier}}));
    if (!reply) return Error{kPosixErrorDomain, EHOSTUNREACH, "spawnd cannot be reached: " + rpx::unreachableText(kEndpoint, "spawnd.socket")};
    if (const auto* fd = (*reply)[protocol::kFd].asFd()) return *fd;
    Error error;
    error.domain = kPosixErrorDomain;
    error.code = (*reply)[protocol::kErrno].int64Value().value_or(EPROTO);
    const std::string* text = (*reply)[protocol::kError].asString();
    error.text = text ? *text : "the service manager gave no reason";
    return error;
}

Result<Array> busyExtensionInstances(const std::vector<std::string>& bundleIdentifiers) {
    Array identifiers(bundleIdentifiers.begin(), bundleIdentifiers.end());
    auto reply = roundTrip(kAssertionEndpoint, dict({{protocol::kBundleIdentifiers, Value(std::move(identifiers))}}));
    const Array* instances = reply ? (*reply)[protocol::kInstances].asArray() : nullptr;
    if (!instances)
        return Error{kPosixErrorDomain, EHOSTUNREACH,
                     "the process-assertion service cannot be reached: " + rpx::unreachableText(kAssertionEndpoint, "spawnd.socket")};
    return *instances;
}

bool isReservedVariable(const std::string& name) {
    return name == "HOME" || name == "TMPDIR" || name == "KFFIXED_USER_HOME" || name.rfind("XDG_", 0) == 0 ||
           name.rfind("CORVANE_", 0) == 0;
}

// ---- the instance's side

std::shared_ptr<InstanceControl> InstanceControl::fromEnvironment(dispatch::QueuePtr queue) {
    const char* text = std::getenv(kControlDescriptorVariable);
    if (!text || !*text) return nullptr;
    char* end = nullptr;
    long fd = std::strtol(text, &end, 10);
    if (*end != '\0' || fd < 0 || fd > 1 << 20 || ::fcntl(static_cast<int>(fd), F_GETFD) < 0) return nullptr;
    auto control = rpx::Connection::adopt(std::make_shared<FileDescriptor>(static_cast<int>(fd)), std::move(queue));
    ::unsetenv(kControlDescriptorVariable);
    return std::shared_ptr<InstanceControl>(new InstanceControl(std::move(control)));
}

InstanceControl::~InstanceControl() { control_->cancel(); }

void InstanceControl::setConnectionHandler(std::function<void(std::shared_ptr<FileDescriptor>)> handler) {
    connectionHandler_ = std::move(handler);
}

void InstanceControl::setInvalidationHandler(std::function<void()> handler) {
    invalidationHandler_ = std::move(handler);
}

void InstanceControl::resume() {
    std::weak_ptr<rpx::Connection> weak = control_;
    control_->setEventHandler([weak, onConnection = connectionHandler_, onInvalid = invalidationHandler_](const rpx::Event& ev) {
        if (ev.isError()) {
            if (onInvalid) onInvalid();
            return;
        }
        auto control = weak.lock();
        const auto* fd = ev.message[protocol::kConnection].asFd();
        if (!control || !fd || !ev.wantsReply) return;
        if (onConnection) onConnection(*fd);
        // The reply tells spawnd that the instance took the connection: from now on it counts as
        // started, and the host gets its end.
        control->sendReply(ev.messageId, Value(Dictionary{}));
    });
    control_->resume();
}

void InstanceControl::setIdle(bool idle) { control_->send(dict({{protocol::kIdle, idle}})); }

uint64_t InstanceControl::beginBusy(const std::string& reason) {
    static std::atomic<uint64_t> next{1};
    uint64_t assertion = next++;
    control_->send(dict({{protocol::kBusy, reason}, {protocol::kAssertion, assertion}}));
    return assertion;
}

void InstanceControl::endBusy(uint64_t assertion) { control_->send(dict({{protocol::kUnbusy, assertion}})); }

}  // namespace corvane::spawn
